// Message intake and stop of a session with no workers, and what a stored message costs in
// memory next to the same payload held as an nlohmann::json object.
//
//   build/release/bench/qv_session_bench
//
// Intake sends ten-key payloads (strings, integers, doubles, a bool, a nested dictionary), every
// second one a repeat of the one before, which the session marks redundant and does not store.
// Each run sends a fixed number of messages into a store that already holds N, so the store grows
// by half that number during the run (reported as stored_at_end).
#include <benchmark/benchmark.h>
#include <malloc.h>
#include <nlohmann/json.hpp>

#include <unistd.h>

#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "BenchPayload.h"
#include "BenchPlatform.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingWorkerRegistry.h"
#include "values/ValueJson.h"

namespace {

using namespace qv;

constexpr std::int64_t kMessagesPerRun = 200000;

// A session with no workers touches only its clock.
struct Env : bench::BenchPlatform {
    Env() : BenchPlatform("qv-session-bench") {
        QVReportingWorkerRegistry::setAllWorkerClasses({});  // a session with no workers
    }
};

Env& env() {
    static Env e;
    return e;
}

Dictionary payload(std::int64_t seq, double now) {
    return bench::playbackPayload(seq, now);
}

std::shared_ptr<QVReportingSession> filledSession(std::int64_t stored) {
    auto s = QVReportingSession::initWithID(env().platform, 1000, {1});
    s->start();
    const double now = env().clock.now();
    for (std::int64_t i = 0; i < stored; ++i) {
        s->sendMessage(std::make_shared<QVReportingSessionMessage>(payload(i, now), 4, 1));
    }
    return s;
}

void BM_SendMessage(benchmark::State& state) {
    const std::int64_t stored = state.range(0);
    auto session = filledSession(stored);
    const double now = env().clock.now();
    std::int64_t seq = stored;
    Dictionary current = payload(seq, now);
    std::int64_t sent = 0;
    for (auto _ : state) {
        // Even sends carry a new state; odd ones repeat it (and are redundant).
        if ((sent & 1) == 0) {
            current.set("sequence", ++seq);
        }
        auto message = std::make_shared<QVReportingSessionMessage>(current, 4, 1);
        session->sendMessage(message);
        benchmark::DoNotOptimize(message->isRedundant());
        ++sent;
    }
    state.counters["stored_at_end"] = static_cast<double>(session->messages().size());
    state.SetItemsProcessed(sent);
}
BENCHMARK(BM_SendMessage)
    ->Arg(1000)
    ->Arg(100000)
    ->Arg(1000000)
    ->Iterations(kMessagesPerRun)
    ->Unit(benchmark::kNanosecond);

void BM_StopWith100kMessages(benchmark::State& state) {
    for (auto _ : state) {
        state.PauseTiming();
        auto session = filledSession(state.range(0));
        state.ResumeTiming();
        session->stop();
        state.PauseTiming();
        session.reset();
        state.ResumeTiming();
    }
}
BENCHMARK(BM_StopWith100kMessages)->Arg(100000)->Iterations(5)->Unit(benchmark::kMillisecond);

std::size_t heapInUse() {
    return mallinfo2().uordblks;
}

// Bytes per stored message, against the same payloads kept as nlohmann::json objects.
void BM_MemoryPerStoredMessage(benchmark::State& state) {
    const std::int64_t n = state.range(0);
    double ours = 0, json = 0;
    for (auto _ : state) {
        const std::size_t before = heapInUse();
        auto session = filledSession(n);
        const std::size_t withSession = heapInUse();
        std::vector<nlohmann::json> asJson;
        asJson.reserve(static_cast<std::size_t>(n) + 2);
        for (const auto& m : session->messages()) {
            asJson.push_back(
                nlohmann::json::parse(QVReportingDictionaryToJson(m->message()).dump()));
        }
        const std::size_t withJson = heapInUse();
        const double count = static_cast<double>(session->messages().size());
        ours = static_cast<double>(withSession - before) / count;
        json = static_cast<double>(withJson - withSession) / count;
        benchmark::DoNotOptimize(asJson.data());
    }
    state.counters["bytes_per_message"] = ours;
    state.counters["json_bytes_per_message"] = json;
}
BENCHMARK(BM_MemoryPerStoredMessage)->Arg(100000)->Iterations(1)->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
