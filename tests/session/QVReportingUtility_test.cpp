#include "session/QVReportingUtility.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <limits>
#include <string>
#include <thread>
#include <vector>

#include "fakes/FakePlatform.h"

namespace qv {
namespace {

using test::FakePlatform;
constexpr double kInf = std::numeric_limits<double>::infinity();
constexpr double kNaN = std::numeric_limits<double>::quiet_NaN();

class QVReportingUtilityInternalBuild : public ::testing::Test {
  protected:
    void SetUp() override { QVReportingUtilityTEST_resetInternalBuild(); }
    void TearDown() override { QVReportingUtilityTEST_resetInternalBuild(); }
};

TEST_F(QVReportingUtilityInternalBuild, AsksTheDeviceOnceEvenFromManyThreadsAndKeepsTheAnswer) {
    FakePlatform silent;  // no answer counts as false
    EXPECT_FALSE(QVReportingUtilityIsInternalBuild(silent.platform));
    QVReportingUtilityTEST_resetInternalBuild();

    FakePlatform internal;
    internal.device.internalBuild = true;
    // The fake's counter is a plain int: a second concurrent question is also a data race.
    std::vector<std::thread> threads;
    std::vector<int> answers(8, -1);
    for (std::size_t i = 0; i < answers.size(); ++i) {
        threads.emplace_back(
            [&, i] { answers[i] = QVReportingUtilityIsInternalBuild(internal.platform) ? 1 : 0; });
    }
    for (auto& t : threads)
        t.join();
    EXPECT_EQ(answers, std::vector<int>(8, 1));
    internal.device.internalBuild = false;  // the first answer is kept
    EXPECT_TRUE(QVReportingUtilityIsInternalBuild(internal.platform));
    EXPECT_EQ(internal.device.questions, 1);
}

TEST(QVReportingUtilityAddDates, StampsACopyRoundingUptimeAndClampingTo32Bits) {
    FakePlatform fake;
    fake.clock.setNow(1706707501.25);
    fake.clock.setSystemUptime(1000.5);
    fake.clock.setProcessCPUTime(250400);  // 250.4 ms
    const Dictionary original{{"systemuptime_sec", "stale"}};
    const Dictionary stamped = QVReportingUtilityAddDates(original, fake.clock);
    EXPECT_EQ(*original.find("systemuptime_sec"), Value("stale"));
    EXPECT_EQ(stamped, (Dictionary{{"systemuptime_sec", 1001},  // half away from zero
                                   {"qvreporting_timestamp", 1706707501.25},
                                   {"processuptime_ms", 250}}));

    const std::tuple<long, double, std::int64_t, std::int64_t> cases[] = {
        // 2^24 + 1 ms: process time goes through a float, so it lands on a neighbour.
        {16777217000L, 1000.4, 16777216, 1000},
        {std::numeric_limits<long>::max(), 1e12, INT32_MAX, INT32_MAX},
        {std::numeric_limits<long>::min(), kNaN, INT32_MIN, 0},
    };
    for (const auto& [cpu, uptime, ms, sec] : cases) {
        fake.clock.setProcessCPUTime(cpu);
        fake.clock.setSystemUptime(uptime);
        const Dictionary d = QVReportingUtilityAddDates({}, fake.clock);
        EXPECT_EQ(d.find("processuptime_ms")->asInt64(), ms) << cpu;
        EXPECT_EQ(d.find("systemuptime_sec")->asInt64(), sec) << uptime;
    }
}

TEST(QVReportingUtilityRoundWithPlaces, RoundsHalvesAwayFromZeroAndSurvivesExtremeInputs) {
    EXPECT_NEAR(QVReportingUtilityRoundWithPlaces(2.345, 2), 2.35, 1e-12);
    EXPECT_TRUE(std::isnan(QVReportingUtilityRoundWithPlaces(kNaN, 2)));
    // Places beyond every double: the value comes back, or zero, never NaN from inf / inf.
    EXPECT_EQ(QVReportingUtilityRoundWithPlaces(1.5, std::numeric_limits<std::int32_t>::max()),
              1.5);
    EXPECT_EQ(QVReportingUtilityRoundWithPlaces(1.5, std::numeric_limits<std::int32_t>::min()), 0);
}

TEST(QVReportingUtilityBucket, PicksTheNearestBucketAndTheLaterOneOnATie) {
    const std::vector<double> buckets{0, 5, 10, 20};
    EXPECT_EQ(QVReportingUtilityBucketNumberToString(7, buckets, 0), "5");
    EXPECT_EQ(QVReportingUtilityBucketNumberToString(7.5, buckets, 0), "10");
    EXPECT_EQ(QVReportingUtilityBucketNumberToString(1, {}, 0), std::nullopt);
    // The walk stops at the first growing distance, sorted or not, and goes on past ties.
    EXPECT_EQ(QVReportingUtilityBucketNumberToString(9, {10, 1, 9}, 0), "10");
    EXPECT_EQ(QVReportingUtilityBucketNumberToString(4, {1, 5, 5, 9}, 0), "5");
    // A NaN value is at no distance from anything, so the walk never stops.
    EXPECT_EQ(QVReportingUtilityBucketNumberToString(kNaN, {1, 2, 3}, 0), "3");
}

TEST(QVReportingUtilityBucket, PrintsUpToPlacesDigitsRoundingTheShortestTextHalfToEven) {
    const std::tuple<double, std::uint64_t, std::string> cases[] = {
        {30, 4, "30.0"},  // at least one fraction digit
        {0.25, 1, "0.2"},
        {0.35, 1, "0.4"},  // the decimal text, not the double just below 0.35
        {9.96, 1, "10.0"},
        {-2.5, 0, "-2"},
        {-0.04, 1, "0.0"},  // no sign on a negative that rounds to zero
        {kNaN, 2, "NaN"},
        {-kInf, 0, "-∞"},
        {0.1, std::uint64_t{1} << 63, "0.1"},  // huge places mean every digit, cheaply
        {5e-324, UINT64_MAX, "0." + std::string(323, '0') + "5"},
    };
    for (const auto& [bucket, places, expected] : cases) {
        EXPECT_EQ(QVReportingUtilityBucketNumberToString(bucket, {bucket}, places), expected)
            << bucket << " " << places;
    }
}

}  // namespace
}  // namespace qv
