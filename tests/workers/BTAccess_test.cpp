#include "workers/backends/BTAccess.h"

#include "workers/WorkerTestSupport.h"

namespace qv {
namespace {

constexpr std::string_view kSuite = "com.korvane.qvsound.qvreporting.audioreg";

using test::accessory;
using test::keysOf;
using test::withElement;

class ABTAccess : public ::testing::Test {
  protected:
    void SetUp() override {
        QVReportingUtilityTEST_resetInternalBuild();
        BaseUnit::TEST_setSleeper([this](std::chrono::milliseconds) { ++pauses; });
    }
    void TearDown() override {
        BaseUnit::TEST_setSleeper({});
        QVReportingUtilityTEST_resetInternalBuild();
    }

    const Array& splunk(const Dictionary& info) {
        const Value* list = info.find("splunk");
        EXPECT_NE(list, nullptr);
        static const Array empty;
        return list && list->asArray() ? *list->asArray() : empty;
    }

    test::FakePlatform fake;
    int pauses = 0;
};

TEST_F(ABTAccess, ReportsEachQualifyingDeviceOnceWithLeftAndRightKeysAndNoCase) {
    // (Lists of 14 or 16 elements and devices without information: the accessories' end-to-end
    // test.)
    fake.bluetooth.addDevice("00:00:00:00:00:01", accessory("K1"), false);
    fake.bluetooth.addDevice("00:00:00:00:00:02", accessory("KX", 15, "M4802"), false);
    fake.bluetooth.addDevice("00:00:00:00:00:03", accessory("K2"), false);
    BTAccess access(fake.platform);
    const Dictionary info = access.gatherData();

    EXPECT_EQ(access.baseUnit().getDeviceCount(), 2);
    const Array& entries = splunk(info);
    ASSERT_EQ(entries.size(), 2u);
    const std::vector<std::string> expectedKeys = {
        "AudioModelNumber",           "AudioFWVersionLeft", "AudioFirstPairingDateLeft",
        "lastConnectedEpoch",         "AudioUUIDLeft",      "AudioFWVersionRight",
        "AudioFirstPairingDateRight", "AudioUUIDRight"};
    const char* keys[] = {"K1", "K2"};
    for (std::size_t i = 0; i < 2; ++i) {
        const Dictionary& e = *entries[i].asDictionary();
        const std::string k = keys[i];
        EXPECT_EQ(keysOf(e), expectedKeys) << "device " << i;
        EXPECT_EQ(e, (Dictionary{{"AudioModelNumber", "M4801"},
                                 {"AudioFWVersionLeft", "e10-" + k},
                                 {"AudioFirstPairingDateLeft", 518400},
                                 {"lastConnectedEpoch", 0},
                                 {"AudioUUIDLeft", "e11-" + k},
                                 {"AudioFWVersionRight", "e10-" + k},
                                 {"AudioFirstPairingDateRight", -1},
                                 {"AudioUUIDRight", "e12-" + k}}));
    }

    // A second gathering starts afresh rather than appending.
    EXPECT_EQ(splunk(access.gatherData()).size(), 2u);
}

TEST_F(ABTAccess, ReportsSerialNumbersUnderTheIdentifierKeysOnInternalBuilds) {
    fake.device.internalBuild = true;
    fake.bluetooth.addDevice("00:00:00:00:00:01", accessory("K1"), false);
    BTAccess access(fake.platform);
    const Dictionary& e = *splunk(access.gatherData())[0].asDictionary();
    EXPECT_EQ(*e.find("AudioUUIDLeft"), Value("e8-K1"));
    EXPECT_EQ(*e.find("AudioUUIDRight"), Value("e9-K1"));
}

TEST_F(ABTAccess, RemembersWhenEachDeviceWasLastSeenConnected) {
    fake.bluetooth.addDevice("00:00:00:00:00:01", accessory("K1"), true);
    fake.bluetooth.addDevice("00:00:00:00:00:02", accessory("K2"), false);
    BTAccess access(fake.platform);
    const double seen = fake.clock.now();
    Dictionary info = access.gatherData();
    EXPECT_EQ(*splunk(info)[0].asDictionary()->find("lastConnectedEpoch"), Value(seen));
    EXPECT_EQ(*splunk(info)[1].asDictionary()->find("lastConnectedEpoch"), Value(0))
        << "never seen connected";
    EXPECT_EQ(fake.preferences.value(kSuite, "BTDevicesLastConnectedEpoch"),
              Value(Dictionary{{"K1", seen}}));

    // Away now: the time it was last seen, not now.
    fake.clock.advance(3600);
    fake.bluetooth.setConnected("00:00:00:00:00:01", false);
    info = access.gatherData();
    EXPECT_EQ(*splunk(info)[0].asDictionary()->find("lastConnectedEpoch"), Value(seen));

    // Back again: now, and the other device's entry stays in the suite.
    fake.clock.advance(60);
    fake.bluetooth.setConnected("00:00:00:00:00:02", true);
    info = access.gatherData();
    EXPECT_EQ(*splunk(info)[1].asDictionary()->find("lastConnectedEpoch"), Value(fake.clock.now()));
    EXPECT_EQ(fake.preferences.value(kSuite, "BTDevicesLastConnectedEpoch"),
              Value(Dictionary{{"K1", seen}, {"K2", fake.clock.now()}}));
}

TEST_F(ABTAccess, WaitsTenPollsForTheFacilityThenKeepsTheDevicesItHad) {
    test::ScopedMemoryLog log;
    fake.bluetooth.addDevice("00:00:00:00:00:01", accessory("K1"), false);
    fake.bluetooth.unavailableAnswers = 3;
    BTAccess access(fake.platform);
    EXPECT_EQ(splunk(access.gatherData()).size(), 1u);
    EXPECT_EQ(pauses, 3) << "a pause before each poll, until the fourth answer says yes";

    // Gone for good: ten polls, then the old list is reported once more.
    fake.bluetooth.neverAvailable();
    fake.bluetooth.devices.clear();
    pauses = 0;
    EXPECT_EQ(splunk(access.gatherData()).size(), 1u);
    EXPECT_EQ(pauses, 10);
    EXPECT_TRUE(log->contains("Timed Out waiting for BT Manager init"));
}

TEST_F(ABTAccess, RefusesElementsOfTheWrongKindWithAnErrorNamingThem) {
    struct Case {
        std::size_t element;
        Value value;
        const char* expected;
    };
    const Case cases[] = {
        {13, "yesterday", "element 13 of TELPVersionInfo of device 00:00:00:00:00:01 is a string"},
        {3, 42, "element 3 of TELPVersionInfo of device 00:00:00:00:00:01 is a number"},
        {10, Array{1, 2}, "element 10 of TELPVersionInfo of device 00:00:00:00:00:01 is a list"},
    };
    for (const auto& c : cases) {
        test::FakePlatform platform;
        platform.bluetooth.addDevice("00:00:00:00:00:01",
                                     withElement(accessory("K1"), c.element, c.value), false);
        BTAccess access(platform.platform);
        try {
            access.gatherData();
            ADD_FAILURE() << "element " << c.element << " accepted";
        } catch (const BTAccessError& e) {
            EXPECT_NE(std::string(e.what()).find(c.expected), std::string::npos) << e.what();
        }
    }
    // A pairing day given as a fraction is cut to whole seconds first.
    test::FakePlatform platform;
    platform.bluetooth.addDevice("00:00:00:00:00:01", withElement(accessory("K1"), 13, 259200.9),
                                 false);
    BTAccess access(platform.platform);
    EXPECT_EQ(*splunk(access.gatherData())[0].asDictionary()->find("AudioFirstPairingDateLeft"),
              Value(518400));
}

TEST(BaseUnitQuantizeEpochToDayofWeek, MovesDaysThreeToFiveForwardAndTheOthersBack) {
    // (epoch, expected)
    const std::int64_t cases[][2] = {
        {0, -86400},               // day 0 (a Thursday): back one day
        {86399, -1},               // still day 0
        {86400, -86400},           // day 1: back two days
        {259199, -1},              // day 2, its last second: back three days
        {259200, 518400},          // day 3: forward three days
        {345600, 691200},          // day 4: forward four days
        {518399, 950399},          // day 5, its last second: forward five days
        {518400, -86400},          // day 6: back seven days
        {604799, -1},              // last second of the week
        {604800, 518400},          // the next week's day 0
        {1706707501, 1706102701},  // a Wednesday in 2024, day 6 of its epoch week
    };
    for (const auto& [epoch, expected] : cases) {
        EXPECT_EQ(BaseUnit::quantizeEpochToDayofWeek(epoch), expected) << epoch;
    }
}

}  // namespace
}  // namespace qv
