// The ICX worker under a flood: 10^5 qualifying haptic messages (type 8, each with its own
// "Haptic_Active_Hardware_Time_Seconds") spread over 16 sessions of an internal build whose device
// has haptic hardware, sent through the session's intake as the server queue does. The same flood
// runs three times, on the real Linux platform on a temporary state directory: sessions without
// workers (workers:0), the daemon's worker table without the ICX worker (workers:1, the
// baseline), the whole table (workers:2), and the ICX worker alone (workers:3), which shows its
// own cost next to workers:0.
//
//   build/release/bench/qv_icx_bench
//
// Figures: ns per message for each run (intake time only, measured around the sends); for the
// whole table, its cost as a multiple of the baseline (intake_ratio) and of sessions without
// workers (ratio_to_no_workers), the snapshot requests made, and what the service did with them:
// captures taken (directories with a manifest) and requests refused, by reason. Each session has
// its own category, so there are 16 signatures: the per-signature interval and the daily limit
// bound the captures.
#include <benchmark/benchmark.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "BenchPlatform.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingStats.h"
#include "session/QVReportingUtility.h"
#include "session/QVReportingWorkerRegistry.h"
#include "workers/QVReportingWorkerClasses.h"
#include "workers/diagnostics/QVReportingSessionICXWorker.h"
#include "workers/diagnostics/WorkerInstanceState.h"

namespace {

using namespace qv;

constexpr std::int64_t kMessages = 100000;
constexpr std::int64_t kSessions = 16;

// The device file of an internal build with haptic hardware, written before the device reads it.
std::string writeDeviceFile(const std::string& stateDir) {
    std::filesystem::create_directories(stateDir);
    const std::string path = stateDir + "/device.json";
    std::ofstream(path) << R"({"InternalBuild": true, "capabilities": {"haptics": true}})";
    return path;
}

struct Env : bench::BenchPlatform {
    Env() : BenchPlatform("qv-icx-bench") {}
    LinuxDeviceInformation capableDevice{writeDeviceFile(stateDir),
                                         std::filesystem::path(stateDir) / "logs"};
    Platform internal = with({.device = &capableDevice});
};

Env& env() {
    static Env e;
    return e;
}

double gBaselineNsPerMessage = 0;   // the daemon's table without the ICX worker
double gNoWorkersNsPerMessage = 0;  // a session without workers

std::size_t capturesTaken() {
    const auto root = std::filesystem::path(env().stateDir) / "logs/Audio/Captures";
    std::size_t n = 0;
    std::error_code ec;
    for (std::filesystem::directory_iterator it(root, ec), end; !ec && it != end;
         it.increment(ec)) {
        n += std::filesystem::exists(it->path() / "manifest.json") ? 1 : 0;
    }
    return n;
}

// The daemon's worker table, with or without the ICX worker.
QVReportingWorkerRegistry::ClassList table(bool withICX) {
    QVReportingWorkerRegistry::ClassList classes = QVReportingAllWorkerClasses();
    if (!withICX) {
        std::erase(classes, &makeWorkerClass<QVReportingSessionICXWorker>());
    }
    return classes;
}

enum Workers { kNone = 0, kTableWithoutICX = 1, kTable = 2, kICXOnly = 3 };

void BM_HapticFlood(benchmark::State& state) {
    const auto workers = static_cast<Workers>(state.range(0));
    const bool withICX = workers == kTable || workers == kICXOnly;
    QVReportingUtilityTEST_resetInternalBuild();
    QVReportingWorkerRegistry::ClassList classes;
    if (workers == kICXOnly) {
        classes = {&makeWorkerClass<QVReportingSessionICXWorker>()};
    } else if (workers != kNone) {
        classes = table(withICX);
    }
    QVReportingWorkerRegistry::TEST_reset(classes);
    QVReportingStats::shared().TEST_reset();
    std::int64_t sent = 0;
    std::int64_t requests = 0;
    const auto firedSoFar = [] {
        // The haptic detector's state is shared by the process: its fire count only grows.
        std::uint64_t fired = 0;
        auto probe = QVReportingSession::initWithID(env().internal, 999, {::getpid()});
        if (auto icx = QVReportingSessionICXWorker::initWithSession(probe)) {
            fired = icx->instances().front()->workerState().firedCount;
        }
        return fired;
    };
    const std::uint64_t firedBefore = firedSoFar();
    std::chrono::steady_clock::duration intake{0};
    for (auto _ : state) {
        state.PauseTiming();
        std::vector<std::shared_ptr<QVReportingSession>> sessions;
        for (std::int64_t s = 0; s < kSessions; ++s) {
            auto session = QVReportingSession::initWithID(env().internal, 1000 + s, {::getpid()});
            session->setServiceType(service::kHaptics);
            session->start();
            sessions.push_back(std::move(session));
        }
        const double now = env().clock.now();
        std::vector<std::shared_ptr<QVReportingSessionMessage>> flood;
        flood.reserve(kMessages);
        for (std::int64_t i = 0; i < kMessages; ++i) {
            const auto category = static_cast<AudioEventCategory>(1 + i % kSessions);
            flood.push_back(std::make_shared<QVReportingSessionMessage>(
                Dictionary{{"Haptic_Active_Hardware_Time_Seconds", 0.001 * static_cast<double>(i)},
                           {"qvreporting_timestamp", now},
                           {"actuator", "main"},
                           {"sequence", i}},
                category, type::kEnergyLog));
        }
        state.ResumeTiming();
        const auto began = std::chrono::steady_clock::now();
        for (std::int64_t i = 0; i < kMessages; ++i) {
            sessions[static_cast<std::size_t>(i % kSessions)]->sendMessage(
                flood[static_cast<std::size_t>(i)]);
        }
        intake += std::chrono::steady_clock::now() - began;
        state.PauseTiming();
        for (auto& s : sessions) {
            s->stop();
        }
        sessions.clear();
        flood.clear();
        env().issueCapture.flush();
        state.ResumeTiming();
        sent += kMessages;
    }
    const double nsPerMessage =
        sent == 0 ? 0
                  : static_cast<double>(
                        std::chrono::duration_cast<std::chrono::nanoseconds>(intake).count()) /
                        static_cast<double>(sent);
    state.counters["ns_per_message"] = nsPerMessage;
    state.SetItemsProcessed(sent);
    if (workers == kNone) {
        gNoWorkersNsPerMessage = nsPerMessage;
    } else if (workers == kTableWithoutICX) {
        gBaselineNsPerMessage = nsPerMessage;
    } else if (workers == kTable) {
        if (gBaselineNsPerMessage > 0) {
            state.counters["intake_ratio"] = nsPerMessage / gBaselineNsPerMessage;
        }
        if (gNoWorkersNsPerMessage > 0) {
            state.counters["ratio_to_no_workers"] = nsPerMessage / gNoWorkersNsPerMessage;
        }
    }
    if (withICX) {
        const Dictionary stats = QVReportingStats::shared().dump();
        const auto counter = [&](const char* key) {
            const Value* v = stats.find(key);
            return v ? v->doubleValue() : 0.0;
        };
        requests = static_cast<std::int64_t>(firedSoFar() - firedBefore);
        state.counters["snapshot_requests"] = static_cast<double>(requests);
        state.counters["captures_taken"] = static_cast<double>(capturesTaken());
        state.counters["refused_throttled"] =
            counter("issue_capture_refused_kIssueCaptureErrorRequestThrottled");
        state.counters["refused_daily_limit"] =
            counter("issue_capture_refused_kIssueCaptureErrorDailyLimitExceeded");
        state.counters["refused_no_room"] =
            counter("issue_capture_refused_kIssueCaptureErrorServiceUnavailable");
    }
}
BENCHMARK(BM_HapticFlood)
    ->ArgName("workers")
    ->Arg(kNone)
    ->Arg(kTableWithoutICX)
    ->Arg(kTable)
    ->Arg(kICXOnly)
    ->Iterations(3)
    ->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
