// Stop of a "test" session whose trace holds 10^5 marker pairs: from the session's stop to the
// results file on disk, as in the daemon (the trace worker alone in the worker table).
//
//   build/release/bench/qv_trace_bench
//
// BM_TraceStop records for real: a tracefs mounted on a directory of the benchmark's own (root
// only; skipped with the reason elsewhere), the Linux recorder with a ring buffer large enough
// for the markers, 10^5 begin/end pairs written to the instance's trace_marker between start and
// stop (not timed). Timed: stop, which switches tracing off, copies the trace out of the kernel,
// removes the instance, reads the trace back, pairs the markers and writes and moves the results
// file. BM_TraceProcessing times the worker's processing of a finished trace (read, pair, write,
// move) on a trace text of 10^5 pairs from four tasks written once, so it runs anywhere.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <sys/mount.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <fstream>
#include <memory>
#include <string>

#include <fmt/format.h>
#include <nlohmann/json.hpp>

#include "BenchPlatform.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingWorkerRegistry.h"
#include "workers/diagnostics/QVReportingSessionTraceWorker.h"

namespace {

using namespace qv;
namespace fs = std::filesystem;

constexpr int kPairs = 100000;

constexpr const char* kProbes = R"(<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><array>
<dict><key>Name</key><string>decode</string>
<key>BeginMarker</key><string>qv:bench:decode:begin</string>
<key>EndMarker</key><string>qv:bench:decode:end</string></dict>
</array></plist>
)";

struct Env : bench::BenchPlatform {
    Env() : BenchPlatform("qv-trace-bench") {
        QVReportingWorkerRegistry::setAllWorkerClasses(
            {&makeWorkerClass<QVReportingSessionTraceWorker>()});
        fs::create_directories(stateDir);
        probes = fs::path(stateDir) / "probes.plist";
        std::ofstream(probes) << kProbes;
        tracefs = fs::path(stateDir) / "tracefs";
        fs::create_directories(tracefs);
        if (::mount("nodev", tracefs.c_str(), "tracefs", 0, nullptr) == 0) {
            mounted = true;
            LinuxSpanTraceRecorder::Options options = traceOptions(stateDir);
            options.tracefsRoot = tracefs;
            // 2 x 10^5 markers of about 40 bytes each, with room for scheduling events.
            options.bufferKbPerCpu = 24 * 1024;
            recorder = std::make_unique<LinuxSpanTraceRecorder>(options, nullptr);
        } else {
            why = fmt::format("cannot mount tracefs: {} (needs root)", std::strerror(errno));
        }
    }
    ~Env() {
        recorder.reset();
        if (mounted) {
            ::umount2(tracefs.c_str(), MNT_DETACH);
        }
    }

    Platform platformWith(SpanTraceRecorder& spanTrace) {
        return with({.device = &internalDevice, .spanTrace = &spanTrace});
    }

    std::shared_ptr<QVReportingSession> testSession(const Platform& p, const std::string& output) {
        auto session = QVReportingSession::initWithID(p, 77, {::getpid()});
        session->setServiceType(service::kTest);
        const Dictionary config{{std::string(QVReportingThreadlinePlistFilePath), probes.string()},
                                {std::string(QVReportingThreadlineOutputFileName), output}};
        session->updateConfigurationWithContentsOfConfiguration(&config);
        return session;
    }

    fs::path results(const std::string& output) const {
        return fs::path(stateDir) / "logs/Audio/Traces" / output;
    }

    LinuxDeviceInformation internalDevice{"/nonexistent", fs::path(stateDir) / "logs", true};
    fs::path probes;
    fs::path tracefs;
    bool mounted = false;
    std::string why;
    std::unique_ptr<LinuxSpanTraceRecorder> recorder;
};

Env& env() {
    static Env e;
    return e;
}

std::size_t resultCount(const fs::path& file) {
    std::ifstream in(file);
    if (!in) {
        return 0;
    }
    return nlohmann::json::parse(in)["values"].size();
}

void BM_TraceStop(benchmark::State& state) {
    Env& e = env();
    if (!e.recorder) {
        state.SkipWithError(e.why.c_str());
        return;
    }
    const Platform platform = e.platformWith(*e.recorder);
    std::size_t values = 0;
    std::uintmax_t traceBytes = 0;
    for (auto _ : state) {
        auto session = e.testSession(platform, "bench.gdj");
        session->start();
        // The one instance of this process that is running.
        fs::path marker;
        for (const auto& entry : fs::directory_iterator(e.tracefs / "instances")) {
            if (entry.path().filename().string().starts_with(
                    fmt::format("qvreportd-{}-", ::getpid()))) {
                marker = entry.path() / "trace_marker";
            }
        }
        const int fd = ::open(marker.c_str(), O_WRONLY | O_CLOEXEC);
        if (fd < 0) {
            state.SkipWithError("the recording's instance has no trace_marker");
            return;
        }
        for (int i = 0; i < kPairs; ++i) {
            benchmark::DoNotOptimize(::write(fd, "qv:bench:decode:begin", 21));
            benchmark::DoNotOptimize(::write(fd, "qv:bench:decode:end", 19));
        }
        ::close(fd);

        const auto begin = std::chrono::steady_clock::now();
        session->stop();
        const auto end = std::chrono::steady_clock::now();
        state.SetIterationTime(std::chrono::duration<double>(end - begin).count());

        values = resultCount(e.results("bench.gdj"));
        traceBytes = 0;
        for (const auto& entry :
             fs::directory_iterator(fs::path(e.stateDir) / "logs/Audio/Traces/raw")) {
            traceBytes = std::max(traceBytes, entry.file_size());
        }
        fs::remove(e.results("bench.gdj"));
    }
    state.counters["values_in_results"] = static_cast<double>(values);
    state.counters["trace_MiB"] = static_cast<double>(traceBytes) / (1024.0 * 1024.0);
}
BENCHMARK(BM_TraceStop)->UseManualTime()->Unit(benchmark::kMillisecond)->Iterations(3);

void BM_TraceProcessing(benchmark::State& state) {
    Env& e = env();
    const fs::path trace = fs::path(e.stateDir) / "prerecorded.trace";
    {
        std::string text = "# qvreportd trace: instance=prerecorded template=2 clock=mono\n";
        text.reserve(kPairs * 2 * 80);
        for (int i = 0; i < kPairs; ++i) {
            const int task = 1000 + i % 4;
            text += fmt::format(
                "     audio-{}-{} [{:03}] ...1.  {}.{:06}: tracing_mark_write: "
                "qv:bench:decode:begin\n",
                task, task, i % 2, 100 + i / 1000, (i % 1000) * 1000);
            text += fmt::format(
                "     audio-{}-{} [{:03}] ...1.  {}.{:06}: tracing_mark_write: "
                "qv:bench:decode:end\n",
                task, task, i % 2, 100 + i / 1000, (i % 1000) * 1000 + 250);
        }
        std::ofstream(trace) << text;
    }
    const Platform platform = e.platformWith(e.spanTrace);
    std::size_t values = 0;
    for (auto _ : state) {
        auto session = e.testSession(platform, "processed.gdj");
        auto worker = QVReportingSessionTraceWorker::initWithSession(session);
        const auto begin = std::chrono::steady_clock::now();
        worker->processTraceThreadline(trace);
        const auto end = std::chrono::steady_clock::now();
        state.SetIterationTime(std::chrono::duration<double>(end - begin).count());
        values = resultCount(e.results("processed.gdj"));
        fs::remove(e.results("processed.gdj"));
    }
    state.counters["values_in_results"] = static_cast<double>(values);
    state.counters["trace_MiB"] = static_cast<double>(fs::file_size(trace)) / (1024.0 * 1024.0);
}
BENCHMARK(BM_TraceProcessing)->UseManualTime()->Unit(benchmark::kMillisecond)->Iterations(5);

}  // namespace

BENCHMARK_MAIN();
