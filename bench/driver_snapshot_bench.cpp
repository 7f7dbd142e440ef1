// The driver-statistics snapshot that a session takes when it starts and the report it sends when
// it stops, read by the Linux library from the counter files of a typical laptop (four sound
// cards, sixteen CPU idle states, four cpufreq policies, eight network devices) in a temporary
// directory, and, for comparison, from this machine's own /proc and /sys.
//
//   build/release/bench/qv_driver_snapshot_bench
//
// Changing the fixture's counters between a start and a stop is not timed; sampling, the
// difference and the messages sent into the session are.
#include <benchmark/benchmark.h>

#include <memory>
#include <string>

#include "BenchPlatform.h"
#include "fixtures/LaptopSysfsFixture.h"
#include "monitoring/QVReportingDriverUtility.h"
#include "monitoring/QVReportingSessionDriverSnapshotWorker.h"
#include "platform/linux/stats/LinuxStatFeed.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingWorkerRegistry.h"

namespace {

using namespace qv;

struct Env : bench::BenchPlatform {
    Env()
        : BenchPlatform("qv-driver-bench"),
          fixture(std::filesystem::path(stateDir) / "sysfs"),
          laptopFeed(fixture.root(), clock),
          laptop(with({.statFeed = &laptopFeed})) {
        QVReportingWorkerRegistry::setAllWorkerClasses(
            {&makeWorkerClass<QVReportingSessionDriverSnapshotWorker>()});
    }

    // Moves a counter of every kind, as a session's worth of activity would.
    void moveCounters() {
        ++round;
        fixture.setNetCounter("wlp0s20f3", "rx_bytes", 1000000 + round * 1500);
        fixture.setNetCounter("wlp0s20f3", "tx_bytes", 1000000 + round * 700);
        fixture.setPcmRunning(0, "pcm0p", 96000 + round * 48000);
        fixture.setInterrupts(test::LaptopSysfsFixture::kHdaIrq, 500 + round * 10);
        fixture.setIdleState(1, 3, 4000000 + round * 250000, 400 + round);
        fixture.setTimeInState(2, {100, 200, 300 + round * 10, 0, 0, 50, 10, round});
    }

    test::LaptopSysfsFixture fixture;
    LinuxStatFeed laptopFeed;
    Platform laptop;
    std::uint64_t round = 0;
};

Env& env() {
    static Env e;
    return e;
}

LinuxStatFeed& feedFor(const benchmark::State& state) {
    static LinuxStatFeed machine("/", env().clock);
    return state.range(0) == 0 ? env().laptopFeed : machine;
}

void setLabel(benchmark::State& state) {
    state.SetLabel(state.range(0) == 0 ? "laptop fixture" : "this machine");
}

// Made once per process in the daemon: one discovery of the tree, the nine groups listed from
// it, the subscriptions. A library of its own each time, so no discovery is reused.
void BM_DriverUtilityInit(benchmark::State& state) {
    const std::filesystem::path root =
        state.range(0) == 0 ? env().fixture.root() : std::filesystem::path("/");
    std::size_t subscriptions = 0;
    for (auto _ : state) {
        LinuxStatFeed feed(root, env().clock);
        QVReportingDriverUtility utility(feed);
        subscriptions = utility.ioChannelSubscriptions().size();
        benchmark::DoNotOptimize(subscriptions);
    }
    state.counters["subscriptions"] = static_cast<double>(subscriptions);
    setLabel(state);
}
BENCHMARK(BM_DriverUtilityInit)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond);

// What a session's start costs: one sample of every subscription.
void BM_DriverSnapshotAtStart(benchmark::State& state) {
    QVReportingDriverUtility utility(feedFor(state));
    std::size_t channels = 0;
    for (auto _ : state) {
        const auto snapshot = utility.getSnapShot();
        channels = 0;
        for (const auto& [driver, samples] : snapshot) {
            channels += samples->channels.size();
        }
    }
    state.counters["channels"] = static_cast<double>(channels);
    setLabel(state);
}
BENCHMARK(BM_DriverSnapshotAtStart)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond);

// What a session's stop costs: samples again, the difference, the three entries' strings.
void BM_DriverReportAtStop(benchmark::State& state) {
    QVReportingDriverUtility utility(feedFor(state));
    std::size_t entries = 0;
    for (auto _ : state) {
        state.PauseTiming();
        const auto start = utility.getSnapShot();
        if (state.range(0) == 0) {
            env().moveCounters();
        }
        state.ResumeTiming();
        const auto stats = utility.computeDriverStats(&start);
        entries = stats.simple.size() + stats.histogram.size() + stats.state.size();
    }
    state.counters["entries"] = static_cast<double>(entries);
    setLabel(state);
}
BENCHMARK(BM_DriverReportAtStop)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond);

// A whole session's start and stop with the snapshot worker, the messages stored in the session.
void BM_SessionStartStopWithDriverSnapshot(benchmark::State& state) {
    auto session = QVReportingSession::initWithID(env().laptop, 42, {1});
    session->start();  // the process-wide utility is made here, outside the timing
    session->stop();
    for (auto _ : state) {
        session->start();
        state.PauseTiming();
        env().moveCounters();
        state.ResumeTiming();
        session->stop();
    }
    QVReportingDriverUtility::TEST_reset();
}
BENCHMARK(BM_SessionStartStopWithDriverSnapshot)->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
