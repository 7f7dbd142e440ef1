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

class QVReportingUtilityInternalBuild : public ::testing::Test {
  protected:
    void SetUp() override { QVReportingUtilityTEST_resetInternalBuild(); }
    void TearDown() override { QVReportingUtilityTEST_resetInternalBuild(); }
};

TEST_F(QVReportingUtilityInternalBuild, AsksTheDeviceOnceAndKeepsTheFirstAnswer) {
    FakePlatform internal;
    internal.device.internalBuild = true;
    EXPECT_TRUE(QVReportingUtilityIsInternalBuild(internal.platform));
    EXPECT_TRUE(QVReportingUtilityIsInternalBuild(internal.platform));
    EXPECT_EQ(internal.device.questions, 1);

    // A later caller with another device gets the stored answer; its device is not asked.
    FakePlatform customer;
    customer.device.internalBuild = false;
    EXPECT_TRUE(QVReportingUtilityIsInternalBuild(customer.platform));
    EXPECT_EQ(customer.device.questions, 0);

    QVReportingUtilityTEST_resetInternalBuild();
    EXPECT_FALSE(QVReportingUtilityIsInternalBuild(customer.platform));
    EXPECT_EQ(customer.device.questions, 1);
}

TEST_F(QVReportingUtilityInternalBuild, IsFalseWhenTheDeviceDoesNotAnswerAndIsNotAskedAgain) {
    FakePlatform silent;  // no answer under "InternalBuild"
    EXPECT_FALSE(QVReportingUtilityIsInternalBuild(silent.platform));
    silent.device.internalBuild = true;
    EXPECT_FALSE(QVReportingUtilityIsInternalBuild(silent.platform));
    EXPECT_EQ(silent.device.questions, 1);
}

TEST_F(QVReportingUtilityInternalBuild, ManyThreadsCallingAtOnceAskTheDeviceOnlyOnce) {
    FakePlatform internal;
    internal.device.internalBuild = true;
    // The fake's question counter is a plain int: a second concurrent question would be a data
    // race that the thread sanitizer reports, and would show in the count.
    std::vector<std::thread> threads;
    std::vector<int> answers(8, -1);
    for (std::size_t i = 0; i < answers.size(); ++i) {
        threads.emplace_back(
            [&, i] { answers[i] = QVReportingUtilityIsInternalBuild(internal.platform) ? 1 : 0; });
    }
    for (auto& t : threads) {
        t.join();
    }
    EXPECT_EQ(internal.device.questions, 1);
    EXPECT_EQ(answers, std::vector<int>(8, 1));
}

TEST(QVReportingUtility, AppNameFallsBackToUnknownOnlyWhenAbsentAndMinimumPlayingTimeIsFixed) {
    EXPECT_EQ(QVReportingUtilityRetrieveAppName({{"HostApplicationDisplayID", "com.x.player"}}),
              "com.x.player");
    EXPECT_EQ(QVReportingUtilityRetrieveAppName({{"HostApplicationDisplayID", ""}}), "");
    EXPECT_EQ(QVReportingUtilityRetrieveAppName({{"KXHostApplicationDisplayID", "other"}}),
              "Unknown");
    EXPECT_EQ(QVReportingUtilityRetrieveAppName({}), "Unknown");
    EXPECT_EQ(QVReportingUtilityRetrieveAppName({{"HostApplicationDisplayID", 42}}), "42");
    // The service type is not consulted (yet).
    EXPECT_EQ(QVReportingUtilityVolumeMinimumPlayingTime(service::kTelephony), 0.5);
    EXPECT_EQ(QVReportingUtilityVolumeMinimumPlayingTime(service::kUnknown), 0.5);
}

TEST(QVReportingUtilityAddDates, StampsACopyAndOverwritesOldStampsInPlace) {
    FakePlatform fake;
    fake.clock.setNow(1706707501.25);
    fake.clock.setSystemUptime(1000.5);
    fake.clock.setProcessCPUTime(250400);  // 250.4 ms
    const Dictionary original{{"a", 1}, {"systemuptime_sec", "stale"}, {"z", "last"}};

    const Dictionary stamped = QVReportingUtilityAddDates(original, fake.clock);

    EXPECT_EQ(original.size(), 3u);
    EXPECT_EQ(*original.find("systemuptime_sec"), Value("stale"));
    ASSERT_EQ(stamped.size(), 5u);
    std::vector<std::string> keys;
    for (const auto& entry : stamped) {
        keys.push_back(entry.first);
    }
    EXPECT_EQ(keys, (std::vector<std::string>{"a", "systemuptime_sec", "z", "qvreporting_timestamp",
                                              "processuptime_ms"}));
    EXPECT_EQ(stamped.find("qvreporting_timestamp")->kind(), Value::Kind::Double);
    EXPECT_EQ(stamped.find("qvreporting_timestamp")->doubleValue(), 1706707501.25);
    EXPECT_EQ(stamped.find("systemuptime_sec")->kind(), Value::Kind::Int);
    EXPECT_EQ(stamped.find("systemuptime_sec")->asInt64(), 1001);  // half away from zero
    EXPECT_EQ(stamped.find("processuptime_ms")->asInt64(), 250);
}

TEST(QVReportingUtilityAddDates, ComputesProcessTimeInSinglePrecisionAndClampsTo32Bits) {
    FakePlatform fake;
    // 2^24 + 1 ms: a float cannot hold it, so the stamp lands on a neighbouring value.
    fake.clock.setProcessCPUTime(16777217000L);
    fake.clock.setSystemUptime(1000.4);
    Dictionary stamped = QVReportingUtilityAddDates({}, fake.clock);
    EXPECT_EQ(stamped.find("processuptime_ms")->asInt64(), 16777216);
    EXPECT_EQ(stamped.find("systemuptime_sec")->asInt64(), 1000);

    fake.clock.setProcessCPUTime(std::numeric_limits<long>::max());
    fake.clock.setSystemUptime(1e12);
    stamped = QVReportingUtilityAddDates({}, fake.clock);
    EXPECT_EQ(stamped.find("processuptime_ms")->asInt64(),
              std::numeric_limits<std::int32_t>::max());
    EXPECT_EQ(stamped.find("systemuptime_sec")->asInt64(),
              std::numeric_limits<std::int32_t>::max());

    fake.clock.setProcessCPUTime(std::numeric_limits<long>::min());
    fake.clock.setSystemUptime(std::numeric_limits<double>::quiet_NaN());
    stamped = QVReportingUtilityAddDates({}, fake.clock);
    EXPECT_EQ(stamped.find("processuptime_ms")->asInt64(),
              std::numeric_limits<std::int32_t>::min());
    EXPECT_EQ(stamped.find("systemuptime_sec")->asInt64(), 0);
}

TEST(QVReportingUtilityRoundWithPlaces, RoundsHalvesAwayFromZeroAndSurvivesExtremeInputs) {
    EXPECT_NEAR(QVReportingUtilityRoundWithPlaces(2.345, 2), 2.35, 1e-12);
    EXPECT_EQ(QVReportingUtilityRoundWithPlaces(1234, -2), 1200);
    EXPECT_EQ(QVReportingUtilityRoundWithPlaces(-1250, -2), -1300);
    EXPECT_EQ(QVReportingUtilityRoundWithPlaces(-2.5, 0), -3);

    const double inf = std::numeric_limits<double>::infinity();
    EXPECT_TRUE(std::isnan(QVReportingUtilityRoundWithPlaces(std::nan(""), 2)));
    EXPECT_EQ(QVReportingUtilityRoundWithPlaces(-inf, -2), -inf);
    // So many places that nothing is left to round: the value comes back, not inf / inf.
    EXPECT_EQ(QVReportingUtilityRoundWithPlaces(1.5, std::numeric_limits<std::int32_t>::max()),
              1.5);
    EXPECT_EQ(QVReportingUtilityRoundWithPlaces(0.1, 20), 0.1);
    EXPECT_EQ(QVReportingUtilityRoundWithPlaces(1e300, 10), 1e300);
    // A power of ten beyond every double leaves zero, not 0 / 0.
    EXPECT_EQ(QVReportingUtilityRoundWithPlaces(1.5, std::numeric_limits<std::int32_t>::min()), 0);
    EXPECT_EQ(QVReportingUtilityRoundWithPlaces(123.456, -400), 0);
    EXPECT_DOUBLE_EQ(QVReportingUtilityRoundWithPlaces(4e300, -300), 4e300);
}

TEST(QVReportingUtilityBucket, PicksTheNearestBucketAndTheLaterOneOnATie) {
    const std::vector<double> buckets{0, 5, 10, 20};
    EXPECT_EQ(QVReportingUtilityBucketNumberToString(7, buckets, 0), "5");
    EXPECT_EQ(QVReportingUtilityBucketNumberToString(7.5, buckets, 0), "10");
    EXPECT_EQ(QVReportingUtilityBucketNumberToString(100, buckets, 0), "20");
    EXPECT_EQ(QVReportingUtilityBucketNumberToString(-3, buckets, 0), "0");
    EXPECT_EQ(QVReportingUtilityBucketNumberToString(1, {}, 0), std::nullopt);
    EXPECT_EQ(QVReportingUtilityBucketNumberToString(0.3, {0.25, 0.5}, 2), "0.25");
    EXPECT_EQ(QVReportingUtilityBucketNumberToString(3, {1, 2, 5}, 1), "2.0");
    // The walk stops at the first growing distance, sorted or not.
    EXPECT_EQ(QVReportingUtilityBucketNumberToString(9, {10, 1, 9}, 0), "10");
    // Repeated buckets tie, and the walk goes on past them.
    EXPECT_EQ(QVReportingUtilityBucketNumberToString(4, {1, 5, 5, 9}, 0), "5");
}

std::string label(double bucket, std::uint64_t places) {
    return QVReportingUtilityBucketNumberToString(bucket, {bucket}, places).value();
}

TEST(QVReportingUtilityBucket, PrintsUpToPlacesDigitsRoundingTheShortestTextHalfToEven) {
    EXPECT_EQ(label(30, 0), "30");
    EXPECT_EQ(label(30, 4), "30.0");  // at least one fraction digit
    EXPECT_EQ(label(0.5, 3), "0.5");
    EXPECT_EQ(label(0.0625, 4), "0.0625");
    EXPECT_EQ(label(1e20, 0), "100000000000000000000");
    EXPECT_EQ(label(123456789.5, 1), "123456789.5");  // no grouping
    EXPECT_EQ(label(0.25, 1), "0.2");
    EXPECT_EQ(label(0.35, 1), "0.4");  // the decimal text, not the double just below 0.35
    EXPECT_EQ(label(2.5000001, 0), "3");
    EXPECT_EQ(label(9.96, 1), "10.0");
    EXPECT_EQ(label(999.5, 0), "1000");
    EXPECT_EQ(label(0.05, 0), "0");
    EXPECT_EQ(label(-2.5, 0), "-2");
    // A negative number that rounds to zero has no sign, so it shares the label of zero.
    EXPECT_EQ(label(-0.04, 1), "0.0");
    EXPECT_EQ(label(-0.0, 0), "0");
}

TEST(QVReportingUtilityBucket, HandlesNonFiniteBucketsAndHugePlaces) {
    const double nan = std::numeric_limits<double>::quiet_NaN();
    const double inf = std::numeric_limits<double>::infinity();
    EXPECT_EQ(label(nan, 2), "NaN");
    EXPECT_EQ(label(inf, 2), "∞");
    EXPECT_EQ(label(-inf, 0), "-∞");
    // A NaN value is at no distance from anything, so the walk never stops.
    EXPECT_EQ(QVReportingUtilityBucketNumberToString(nan, {1, 2, 3}, 0), "3");

    // Huge places mean every digit, at no huge cost.
    EXPECT_EQ(label(0.1, std::uint64_t{1} << 63), "0.1");
    EXPECT_EQ(label(5e-324, std::numeric_limits<std::uint64_t>::max()),
              "0." + std::string(323, '0') + "5");
    const std::string big = label(-1.7976931348623157e308, 0);
    EXPECT_EQ(big.size(), 310u);
    EXPECT_EQ(big.substr(0, 18), "-17976931348623157");
}

TEST(QVReportingUtility, KeyIsPresentAndHasChangedOnlyWhenBothHoldDifferentValues) {
    const Dictionary one{{"k", 1}, {"s", "1"}, {"d", Dictionary{{"x", 1}}}};
    const Dictionary two{{"k", 2}, {"s", 1}, {"d", Dictionary{{"x", 1.0}}}};
    const Dictionary oneAsDouble{{"k", 1.0}};
    const Dictionary empty;
    EXPECT_TRUE(QVReportingUtilityKeyIsPresentAndHasChanged("k", &one, &two));
    EXPECT_FALSE(QVReportingUtilityKeyIsPresentAndHasChanged("k", &one, &one));
    EXPECT_FALSE(QVReportingUtilityKeyIsPresentAndHasChanged("k", &one, &oneAsDouble));
    EXPECT_TRUE(QVReportingUtilityKeyIsPresentAndHasChanged("s", &one, &two));
    EXPECT_FALSE(QVReportingUtilityKeyIsPresentAndHasChanged("d", &one, &two));
    EXPECT_FALSE(QVReportingUtilityKeyIsPresentAndHasChanged("k", &one, &empty));
    EXPECT_FALSE(QVReportingUtilityKeyIsPresentAndHasChanged("k", nullptr, &one));
    EXPECT_FALSE(QVReportingUtilityKeyIsPresentAndHasChanged("k", &one, nullptr));
    EXPECT_FALSE(QVReportingUtilityKeyIsPresentAndHasChanged("absent", &one, &two));
}

}  // namespace
}  // namespace qv
