#include "monitoring/QVReportingDriverUtility.h"

#include <limits>

#include "monitoring/QVReportingSessionDriverSnapshotWorker.h"
#include "workers/WorkerTestSupport.h"
#include "workers/backends/QVReportingSessionMetricsHubWorker.h"

namespace qv {
namespace {

using test::FakeStatFeed;
using F = ChannelStatsFormat;

std::optional<std::string> none() {
    return std::nullopt;
}

// One channel of a fake sample, read through the utility as the report reads it.
class AChannelEntry : public ::testing::Test {
  protected:
    StatFeedChannel channel(F format, std::optional<std::string> driver,
                            std::optional<std::string> group, std::optional<std::string> subgroup,
                            std::optional<std::string> name,
                            std::optional<std::string> unit = std::nullopt) {
        auto info = std::make_shared<StatFeedChannelInfo>();
        info->format = format;
        info->driverName = std::move(driver);
        info->group = std::move(group);
        info->subgroup = std::move(subgroup);
        info->name = std::move(name);
        info->unit = std::move(unit);
        StatFeedChannel c;
        c.info = info;
        return c;
    }

    FakeStatFeed feed;  // publishes nothing: the utility subscribes to no driver
    test::ScopedMemoryLog log;
    QVReportingDriverUtility utility{feed};
};

TEST_F(AChannelEntry, KeyCutsTheDriverAtItsInstanceAndDropsSeparatorsAndAbsentParts) {
    struct Case {
        std::optional<std::string> driver, group, subgroup, name;
        std::string type, key;
    };
    const std::vector<Case> cases = {
        {"a_b c<d_e>", "g_1", "s 2", "n_ a", "Histogram", "abc_g1_s2_Histogram_na"},
        {"d", "g", "s", none(), "Simple", "d_g_s_Simple"},
        {none(), none(), none(), none(), "State", "State"},
        {none(), "Tx", none(), "x", "Simple", "Tx_Simple_x"},
        // A driver name that is all instance still gives its (empty) part.
        {"<card0>", "G", "S", "N", "Simple", "_G_S_Simple_N"},
        {"x<a<b", "__", " ", "_ _", "State", "x___State_"},
    };
    for (const Case& c : cases) {
        EXPECT_EQ(utility.getDriverStatsKey(
                      channel(F::Simple, c.driver, c.group, c.subgroup, c.name), c.type),
                  c.key);
    }
}

// (Only buckets with hits, no trailing ";", lower from 0 and the state list's shape: the driver
// statistics' end-to-end test.)
TEST_F(AChannelEntry, HistogramBoundsReachZeroAndSimpleValuesSaturate) {
    StatFeedChannel h = channel(F::Histogram, "drv", "G", none(), "lat");
    h.buckets = {{-10, -5, 2}, {-5, -1, 0}};
    h.minimum = -3;
    h.maximum = 77;
    Dictionary stats;
    utility.processHistogramData(h, stats);
    EXPECT_EQ(stats,
              (Dictionary{{"drv_G_Histogram_lat",
                           "count=2,lower=-10,upper=0,min=-3,max=77,unit=(null)::-10--5:2"}}));

    // A bucket whose bounds cannot be read is logged and left out of bounds and list.
    h = channel(F::Histogram, "drv", "G", none(), "lat", "ms");
    h.buckets = {{0, 10, 3}, {0, 0, 5, /*boundsError=*/5}, {10, 1000, 1}};
    stats.clear();
    utility.processHistogramData(h, stats);
    EXPECT_EQ(*stats.find("drv_G_Histogram_lat")->asString(),
              "count=3,lower=0,upper=1000,min=0,max=0,unit=ms::0-10:3;10-1000:1");
    EXPECT_TRUE(log->contains("Error in getting the bucket bounds : 5"));

    StatFeedChannel c = channel(F::Simple, "d", "Rx", none(), "n");
    c.simple = std::numeric_limits<std::uint64_t>::max();
    stats.clear();
    utility.processSimpleData(c, stats);
    EXPECT_EQ(*stats.find("d_Rx_Simple_n")->asInt64(), std::numeric_limits<std::int64_t>::max());
}

// The snapshot worker in a session whose messages MetricsHub forwards to the fake analytics.
class ADriverSnapshot : public ::testing::Test {
  protected:
    void SetUp() override { QVReportingDriverUtility::TEST_reset(); }
    void TearDown() override { QVReportingDriverUtility::TEST_reset(); }

    std::shared_ptr<QVReportingSession> session(ReporterID id = 9) {
        return QVReportingSession::initWithID(fake.platform, id, {4321});
    }
    // The ChannelStats events in the order they were sent: (type, payload without the keys the
    // session stamps).
    std::vector<std::pair<std::string, Dictionary>> channelStats() const {
        std::vector<std::pair<std::string, Dictionary>> out;
        for (const auto& e : fake.analytics.events) {
            const std::string prefix = "com.korvane.qvsound.ChannelStats.";
            if (e.name.rfind(prefix, 0) != 0) {
                continue;
            }
            Dictionary payload = e.payload;
            for (const char* k : {"qvreporting_timestamp", "invalid_timestamp", "audiotag",
                                  "HostApplicationDisplayID"}) {
                payload.erase(k);
            }
            out.emplace_back(e.name.substr(prefix.size()), std::move(payload));
        }
        return out;
    }

    test::ScopedWorkerClasses<QVReportingSessionMetricsHubWorker,
                              QVReportingSessionDriverSnapshotWorker>
        workerClasses;
    test::FakePlatform fake;
    test::ScopedMemoryLog log;
};

TEST_F(ADriverSnapshot, SendsTheChangesAtStopAndDropsFormatsItCannotRead) {
    FakeStatFeed& feed = fake.statFeed;
    const auto rx = feed.publish(F::Simple, "AE2<0x1>", "Rx", none(), "rx bytes");
    const auto still = feed.publish(F::Simple, "AE2<0x1>", "Rx", none(), "rx drops");
    const auto array = feed.publish(F::SimpleArray, "AE2<0x1>", "Rx", none(), "arr");
    const auto invalid = feed.publish(F::Invalid, "dsp", none(), "MCA", "bad");
    const auto odd = feed.publish(static_cast<F>(7), "dsp", none(), "MCA", "future");
    const auto idle =
        feed.publish(F::State, "idle<cpu0>", "StateTransitionTimes_ms", none(), "cpu0");
    feed.setSimple(rx, 100);
    feed.setSimple(still, 7);
    feed.setSimple(array, 1);
    feed.setSimple(invalid, 1);
    feed.setSimple(odd, 1);
    feed.update(idle, [](auto& r) { r.states = {{"C1", 10, 1000, 0}, {"C6", 2, 500, 0}}; });
    // The pdm group cannot be listed: the driver is skipped, the others are not.
    feed.failChannelsFor("pdm-(null)", 5);

    auto s = session();
    s->start();
    // A driver that had no channels when the utility was made is never part of a report.
    const auto late = feed.publish(F::Simple, "late", "Tx", none(), "n");
    feed.setSimple(late, 50);

    feed.setSimple(rx, 250);
    feed.setSimple(array, 9);
    feed.setSimple(invalid, 9);
    feed.setSimple(odd, 9);
    feed.update(idle, [](auto& r) { r.states = {{"C1", 14, 1000, 0}, {"C6", 5, 900, 0}}; });
    feed.advanceUptime(2.0);
    s->stop();

    const auto stats = channelStats();
    // (Histograms, and the order of the kinds: the driver statistics' end-to-end test.)
    EXPECT_EQ(stats, (std::vector<std::pair<std::string, Dictionary>>{
                         {"Simple", {{"AE2_Rx_Simple_rxbytes", 150}}},
                         {"State",
                          {{"idle_StateTransitionTimesms_State_cpu0",
                            "name:C6,transition:3,residency:400,duty_cycle:0.200000;"}}}}));

    EXPECT_TRUE(log->contains("error 5 getting channels for driver pdm-(null)"));
    EXPECT_TRUE(log->contains("Dropping sample of type : 4 for group : Rx subgroup : (null)"));
    EXPECT_TRUE(log->contains("Dropping sample of type : 0 for group : (null) subgroup : MCA"));
    EXPECT_TRUE(
        log->contains("The ChannelStatsFormat 7 is not supported group : (null) subgroup : MCA"));
}

TEST_F(ADriverSnapshot, IsMadeOncePerProcessAndReportsNothingWithoutChangesOrStartSamples) {
    FakeStatFeed& feed = fake.statFeed;
    const auto rx = feed.publish(F::Simple, "nic", "Rx", none(), "bytes");
    feed.setSimple(rx, 10);

    // Two sessions share the utility: the library is listed once for the nine drivers.
    auto a = session(1);
    auto b = session(2);
    a->start();
    b->start();
    EXPECT_EQ(feed.channelsInGroupCalls(), 9);
    // Nothing moved: no message.
    a->stop();
    EXPECT_TRUE(channelStats().empty());

    b->stop();

    // Sampling that fails at stop is logged and sends nothing.
    a->start();
    feed.setSimple(rx, 30);
    feed.failSamples(5);
    a->stop();
    EXPECT_TRUE(channelStats().empty());
    EXPECT_TRUE(log->contains("StatFeedCreateSamples error 5"));

    // Without start samples the report samples again and compares nothing.
    feed.failSamples(0);
    const int before = feed.createSamplesCalls();
    const auto utility = QVReportingDriverUtility::existingUtility();
    ASSERT_TRUE(utility);
    utility->sendDriverLogsForSession(a, nullptr);
    EXPECT_EQ(feed.createSamplesCalls(), before + 1);
    EXPECT_TRUE(channelStats().empty());

    // A start that failed to sample leaves that driver out of the stop's report.
    feed.failSamples(5);
    a->start();
    feed.failSamples(0);
    feed.setSimple(rx, 90);
    a->stop();
    EXPECT_TRUE(channelStats().empty());
}

}  // namespace
}  // namespace qv
