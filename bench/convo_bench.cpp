// The Convo worker's two costs that clients feel, on the real Linux platform (the Convo service
// writing its sink, the pool of the task executor):
//
//   build/release/bench/qv_convo_bench
//
// - BM_Intake/<table>: sendMessage of a started generic session, as the server queue runs it,
//   with every worker of the daemon's table that such a session starts ("table": MetricsHub and
//   Convo today, and whatever joins the table later), next to the same session with MetricsHub
//   alone ("metricshub"). Every message is new (none is redundant), so each reaches every
//   consumer. Only the calling thread is timed; the pool, the Convo service and the sinks work
//   on their own threads meanwhile, as in the daemon, and drop what they cannot keep up with
//   (counted, reported as convo_lost / analytics_lost).
// - BM_Intake/<table>/1 ("... drained"): the same, with the CPU of the whole process timed and
//   the pool and the sinks drained every kDrainEvery messages, so that none is dropped: all the
//   work one message makes behind the bus, on every thread: the part of the load generator's
//   daemon figure that is not the bus thread's.
// - BM_ConvoStopSummary/<n>/1: stop of a session of n messages with the Convo worker alone, from
//   the stop call until the pool is idle again: the copy taken on the server queue, the summary
//   built, sent and flushed on the Convo queue. The fill and its forwarding are not timed.
//   BM_ConvoStopSummary/<n>/0 is the same session without the worker: what the session's own
//   stop costs (sorting and freeing its messages), to subtract.
//
// QV_ONE=1 runs each stop once (for valgrind --tool=callgrind).
#include <benchmark/benchmark.h>

#include <chrono>
#include <cstdlib>
#include <memory>
#include <string>

#include "BenchPayload.h"
#include "BenchPlatform.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingStats.h"
#include "session/QVReportingWorkerRegistry.h"
#include "workers/QVReportingWorkerClasses.h"
#include "workers/backends/QVReportingSessionConvoWorker.h"
#include "workers/backends/QVReportingSessionMetricsHubWorker.h"

namespace {

using namespace qv;

// Log lines are formatted as in the daemon, then dropped: a flood makes the Convo worker log one
// error line per message the full sink refuses, and a terminal would time its own scrolling.
class DiscardingLogSink : public LogSink {
  public:
    void write(LogLevel, const QVReportingLogCategory&, std::string_view) override {}
};

struct Env : bench::BenchPlatform {
    Env() : BenchPlatform("qv-convo-bench") { setLogSink(std::make_shared<DiscardingLogSink>()); }

    // Waits for the pool and the sinks to finish what the last run left them.
    void settle() {
        executor.waitUntilIdle(std::chrono::seconds(30));
        analytics.service->flush();
        convo.flush();
    }
};

Env& env() {
    static Env e;
    return e;
}

// Ten keys of the usual kinds, as a client reports a playback state; a new time on each.
Dictionary payload(std::int64_t seq, double now) {
    return bench::playbackPayload(seq, now + static_cast<double>(seq) * 0.0137);
}

// A started generic session whose Convo session (if it has the worker) is live.
std::shared_ptr<QVReportingSession> startedSession(ReporterID id) {
    auto session = QVReportingSession::initWithID(env().platform, id, {1});
    session->setServiceType(service::kGeneric);
    session->start();
    env().settle();
    return session;
}

// Fewer lines than a sink holds (two analytics lines a message).
constexpr std::int64_t kDrainEvery = 1024;

void BM_Intake(benchmark::State& state) {
    const bool wholeTable = state.range(0) == 1;
    const bool drained = state.range(1) == 1;
    QVReportingWorkerRegistry::TEST_reset(
        wholeTable ? QVReportingAllWorkerClasses()
                   : QVReportingWorkerRegistry::ClassList{
                         &makeWorkerClass<QVReportingSessionMetricsHubWorker>()});
    state.SetLabel(std::string(wholeTable ? "table" : "metricshub") + (drained ? " drained" : ""));
    auto& stats = QVReportingStats::shared();
    const auto convoLostBefore = stats.sinkLinesLost("convo");
    const auto analyticsLostBefore = stats.sinkLinesLost("analytics");

    auto session = startedSession(wholeTable ? 3001 : 3002);
    const double now = env().clock.now();
    std::int64_t seq = 0;
    for (auto _ : state) {
        session->sendMessage(std::make_shared<QVReportingSessionMessage>(
            payload(++seq, now), category::kPlayback, type::kState));
        if (drained && seq % kDrainEvery == 0) {
            env().settle();
        }
    }
    state.counters["workers"] = static_cast<double>(session->workerInstanceCount());
    state.counters["convo_lost"] =
        static_cast<double>(stats.sinkLinesLost("convo") - convoLostBefore);
    state.counters["analytics_lost"] =
        static_cast<double>(stats.sinkLinesLost("analytics") - analyticsLostBefore);
    session->stop();
    session.reset();
    env().settle();
    state.SetItemsProcessed(seq);
}
BENCHMARK(BM_Intake)->Args({0, 0})->Args({1, 0})->Iterations(200000)->Repetitions(3)->Unit(
    benchmark::kNanosecond);
BENCHMARK(BM_Intake)
    ->Args({0, 1})
    ->Args({1, 1})
    ->MeasureProcessCPUTime()
    ->UseRealTime()
    ->Iterations(100000)
    ->Repetitions(3)
    ->Unit(benchmark::kNanosecond);

void BM_ConvoStopSummary(benchmark::State& state) {
    const bool withConvo = state.range(1) == 1;
    QVReportingWorkerRegistry::TEST_reset(
        withConvo ? QVReportingWorkerRegistry::ClassList{&makeWorkerClass<
                        QVReportingSessionConvoWorker>()}
                  : QVReportingWorkerRegistry::ClassList{});
    state.SetLabel(withConvo ? "convo" : "no worker");
    const std::int64_t n = state.range(0);
    double serverQueue = 0;  // the stop call, copy included (ms, summed)
    double convoQueue = 0;   // from its return until the pool is idle (ms, summed)
    for (auto _ : state) {
        state.PauseTiming();
        auto session = startedSession(4000);
        const double now = env().clock.now();
        for (std::int64_t i = 0; i < n; ++i) {
            session->sendMessage(std::make_shared<QVReportingSessionMessage>(
                payload(i, now), category::kPlayback, type::kState));
        }
        env().settle();
        state.ResumeTiming();

        const auto begin = std::chrono::steady_clock::now();
        session->stop();
        const auto stopped = std::chrono::steady_clock::now();
        env().executor.waitUntilIdle(std::chrono::seconds(30));
        const auto idle = std::chrono::steady_clock::now();

        state.PauseTiming();
        serverQueue += std::chrono::duration<double, std::milli>(stopped - begin).count();
        convoQueue += std::chrono::duration<double, std::milli>(idle - stopped).count();
        session.reset();
        env().settle();
        state.ResumeTiming();
    }
    state.counters["stop_call_ms"] = serverQueue / static_cast<double>(state.iterations());
    state.counters["convo_queue_ms"] = convoQueue / static_cast<double>(state.iterations());
    state.SetItemsProcessed(state.iterations() * n);
}
BENCHMARK(BM_ConvoStopSummary)
    ->Args({10000, 0})
    ->Args({10000, 1})
    ->Args({100000, 0})
    ->Args({100000, 1})
    ->Iterations(std::getenv("QV_ONE") ? 1 : 5)
    ->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
