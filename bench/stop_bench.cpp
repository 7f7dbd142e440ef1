// Stop of a session with the workers that derive messages (volume, summary, input, summary JSON
// file) and MetricsHub, as in the daemon, holding n realistic messages: playback that starts and
// stops with volume steps and a spatial-audio toggle, recording with two codecs and a route
// change, overloads. The session is a "test" session, so the summary file is written too.
//
//   build/release/bench/qv_stop_bench
//
// Filling the session and draining the analytics sink of what the fill sent are not timed; the
// stop and everything it derives, forwards and writes is. Reported per message as well, to show
// how the cost grows with n.
#include <benchmark/benchmark.h>

#include <memory>
#include <string>

#include "BenchPlatform.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingWorkerRegistry.h"
#include "workers/backends/QVReportingSessionMetricsHubWorker.h"
#include "workers/derived/QVReportingSessionInputMessagesWorker.h"
#include "workers/derived/QVReportingSessionSummaryJsonFileWorker.h"
#include "workers/derived/QVReportingSessionSummaryWorker.h"
#include "workers/derived/QVReportingSessionVolumeMessagesWorker.h"

namespace {

using namespace qv;

struct Env : bench::BenchPlatform {
    Env() : BenchPlatform("qv-stop-bench") {
        QVReportingWorkerRegistry::setAllWorkerClasses({
            &makeWorkerClass<QVReportingSessionVolumeMessagesWorker>(),
            &makeWorkerClass<QVReportingSessionSummaryWorker>(),
            &makeWorkerClass<QVReportingSessionInputMessagesWorker>(),
            &makeWorkerClass<QVReportingSessionMetricsHubWorker>(),
            &makeWorkerClass<QVReportingSessionSummaryJsonFileWorker>(),
        });
    }
};

Env& env() {
    static Env e;
    return e;
}

// Message i of a cycle of 20: a playback stretch, then a recording stretch, then overloads.
std::shared_ptr<QVReportingSessionMessage> realistic(std::int64_t i, double t0) {
    const std::int64_t step = i % 20;
    const double t = t0 + static_cast<double>(i) * 0.75;
    Dictionary p{{"qvreporting_timestamp", t}};
    AudioEventCategory c = category::kGeneric;
    AudioEventType k = type::kState;
    if (step == 0) {
        p.set("session_output_running", true);
        p.set("KXSessionVolume", 0.5);
        p.set("active_devices", "Speaker");
        p.set("session_selected_format", "lpcm 48000 Hz 2 ch");
        p.set("mFormatID", "lpcm");
        p.set("mChannelsPerFrame", 2);
        c = category::kPlayback;
        k = type::kStart;
    } else if (step <= 7) {
        p.set("KXSessionVolume", static_cast<double>((i + step) % 17) / 16.0);
        c = category::kVolume;
    } else if (step <= 9) {
        p.set("spatializationEnabled", step == 8);
        p.set("spatial-audio-accessory-feature", step == 8);
        c = category::kOutput;
    } else if (step == 10) {
        p.set("session_output_running", false);
        p.set("session_duration", 7.5);
        c = category::kPlayback;
        k = type::kStop;
    } else if (step == 11) {
        p.set("session_input_running", true);
        p.set("vp_config_primary_vocoder", "opus");
        p.set("vp_config_primary_vocoderFs", "16000");
        p.set("vp_config_operation_mode", "voice");
        c = category::kRecord;
        k = type::kStart;
    } else if (step <= 14) {
        p.set("vp_config_primary_vocoder", step % 2 ? "aac" : "opus");
        p.set("vp_config_primary_vocoderFs", "24000");
        c = category::kInput;
    } else if (step == 15) {
        p.set("active_devices", i % 40 < 20 ? "Headset" : "Speaker");
        c = category::kRouteChange;
    } else if (step == 16) {
        p.set("session_input_running", false);
        p.set("session_duration", 3.75);
        c = category::kRecord;
        k = type::kStop;
    } else {
        p.set("issue_type", "overload");
        p.set("sequence", i);
    }
    return std::make_shared<QVReportingSessionMessage>(std::move(p), c, k);
}

void BM_StopWithDerivedWorkers(benchmark::State& state) {
    const std::int64_t n = state.range(0);
    for (auto _ : state) {
        state.PauseTiming();
        auto session = QVReportingSession::initWithID(env().platform, 2000, {1});
        session->setServiceType(service::kTest);
        session->start();
        const double t0 = env().clock.now() - static_cast<double>(n);
        for (std::int64_t i = 0; i < n; ++i) {
            session->sendMessage(realistic(i, t0));
        }
        env().analytics.service->flush();
        state.ResumeTiming();

        session->stop();

        state.PauseTiming();
        env().analytics.service->flush();
        session.reset();
        state.ResumeTiming();
    }
    state.SetItemsProcessed(state.iterations() * n);
    state.SetComplexityN(n);
}
BENCHMARK(BM_StopWithDerivedWorkers)
    ->Arg(1000)
    ->Arg(10000)
    ->Arg(100000)
    ->Iterations(5)
    ->Unit(benchmark::kMillisecond)
    ->Complexity(benchmark::oNLogN);

}  // namespace

BENCHMARK_MAIN();
