#include "workers/backends/QVReportingSessionAudioRegistrationWorker.h"

#include <cstdlib>
#include <ctime>
#include <thread>

#include "workers/WorkerTestSupport.h"
#include "workers/backends/BaseUnit.h"

namespace qv {
namespace {

using Worker = QVReportingSessionAudioRegistrationWorker;
constexpr std::string_view kSuite = "com.korvane.qvsound.qvreporting.audioreg";
constexpr const char* kTriggerText = "BT Headphones: qwrT ( b71c ) ( 6402 ), Speaker";

using test::accessory;

// Sets TZ for one test and puts the old zone back after it.
class ScopedTimeZone {
  public:
    explicit ScopedTimeZone(const char* zone) {
        if (const char* old = std::getenv("TZ")) {
            old_ = old;
        }
        ::setenv("TZ", zone, 1);
        ::tzset();
    }
    ~ScopedTimeZone() {
        if (old_) {
            ::setenv("TZ", old_->c_str(), 1);
        } else {
            ::unsetenv("TZ");
        }
        ::tzset();
    }

  private:
    std::optional<std::string> old_;
};

class AnAudioRegistrationWorker : public ::testing::Test {
  protected:
    void SetUp() override {
        Worker::TEST_resetSharedState();
        Worker::TEST_setRandomSource([](std::uint32_t) { return 12345u; });
        BaseUnit::TEST_setSleeper([](std::chrono::milliseconds) {});
    }
    void TearDown() override {
        Worker::TEST_resetSharedState();
        Worker::TEST_setRandomSource({});
        BaseUnit::TEST_setSleeper({});
    }

    std::shared_ptr<QVReportingSession> started(ReporterID id = 7) {
        return test::makeSession(fake.platform, {.id = id, .start = true});
    }
    // Each one differs from the last, so the session never drops it as redundant.
    std::shared_ptr<QVReportingSessionMessage> devices(const char* text) {
        return std::make_shared<QVReportingSessionMessage>(
            Dictionary{{"active_devices", text}, {"route", ++routes}}, category::kRouteChange,
            type::kGeneric);
    }
    std::optional<Value> stored(std::string_view key) {
        return fake.preferences.value(kSuite, key);
    }
    double storedDouble(std::string_view key) {
        return stored(key).value_or(Value()).doubleValue();
    }
    // Registration information whose devices were last seen connected at these times.
    void storeRegistration(std::initializer_list<double> lastConnected) {
        Array entries;
        int n = 0;
        for (double t : lastConnected) {
            entries.emplace_back(Dictionary{{"AudioModelNumber", "M4801"},
                                            {"AudioUUIDLeft", "L" + std::to_string(++n)},
                                            {"lastConnectedEpoch", t}});
        }
        fake.preferences.setValue(kSuite, "ELRegistrationInfo",
                                  Dictionary{{"splunk", Value(std::move(entries))}});
    }
    void dueNow() {
        fake.preferences.setValue(kSuite, "AudioRegistrationNextInvocationEpoch",
                                  fake.clock.now() - 1);
    }
    std::vector<test::FakeConvoService::Sent> sent() {
        auto lock = fake.convo.lock();
        std::vector<test::FakeConvoService::Sent> all;
        for (const auto& s : fake.convo.sessions) {
            all.insert(all.end(), s->sent.begin(), s->sent.end());
        }
        return all;
    }

    test::ScopedWorkerClasses<Worker> workerClasses;
    test::FakePlatform fake;
    test::ScopedMemoryLog log;
    int routes = 0;
};

TEST_F(AnAudioRegistrationWorker, GathersOnTheTriggerAtMostOnceAMinute) {
    fake.bluetooth.addDevice("00:00:00:00:00:01", accessory("K1"), true);
    auto session = started();
    EXPECT_EQ(stored("ELRegistrationInfo"), Value(Dictionary{})) << "defaults set at first use";

    // No trigger: no key, another device, the trigger's words in another order.
    session->sendMessage(std::make_shared<QVReportingSessionMessage>(
        Dictionary{{"other", kTriggerText}}, category::kRouteChange, type::kGeneric));
    session->sendMessage(devices("Speaker, qwrT ( b71c ) ( 6403 )"));
    session->sendMessage(devices("qwrT ( 6402 ) ( b71c )"));
    EXPECT_EQ(fake.bluetooth.availabilityQuestions, 0);
    EXPECT_EQ(stored("AudioRegistrationELEnumerationCheckEpoch"), std::nullopt);

    const double first = fake.clock.now();
    session->sendMessage(devices(kTriggerText));
    EXPECT_EQ(fake.bluetooth.availabilityQuestions, 1);
    EXPECT_EQ(storedDouble("AudioRegistrationELEnumerationCheckEpoch"), first + 60);

    // 30 s later (and 59.9 s later): not again.
    fake.clock.advance(30);
    session->sendMessage(devices(kTriggerText));
    fake.clock.advance(29.9);
    session->sendMessage(devices(kTriggerText));
    EXPECT_EQ(fake.bluetooth.availabilityQuestions, 1);

    // A minute after the first: again, and a second device shows.
    fake.bluetooth.addDevice("00:00:00:00:00:02", accessory("K2"), false);
    fake.clock.setNow(first + 60);
    session->sendMessage(devices(kTriggerText));
    EXPECT_EQ(fake.bluetooth.availabilityQuestions, 2);
    EXPECT_EQ(storedDouble("AudioRegistrationELEnumerationCheckEpoch"), first + 120);
    EXPECT_EQ(stored("ELRegistrationInfo")->asDictionary()->find("splunk")->asArray()->size(), 2u);

    // The schedule survives a restart of the process: a worker made afresh reads it back.
    Worker::TEST_resetSharedState();
    auto later = started(8);
    fake.clock.setNow(first + 90);
    later->sendMessage(devices(kTriggerText));
    EXPECT_EQ(fake.bluetooth.availabilityQuestions, 2);
}

TEST_F(AnAudioRegistrationWorker, KeepsTheLastGoodRegistrationWhenAGatheringFails) {
    fake.bluetooth.addDevice("00:00:00:00:00:01", accessory("K1"), false);
    auto session = started();
    session->sendMessage(devices(kTriggerText));
    const auto good = stored("ELRegistrationInfo");

    fake.bluetooth.addDevice("00:00:00:00:00:02",
                             test::withElement(accessory("K2"), 13, "last week"), false);
    fake.clock.advance(61);
    session->sendMessage(devices(kTriggerText));
    EXPECT_TRUE(log->contains("Exception in BT gatherData : element 13 of TELPVersionInfo"));
    EXPECT_EQ(stored("ELRegistrationInfo"), good);
    // The schedule did not move, so the next trigger tries again at once.
    session->sendMessage(devices(kTriggerText));
    EXPECT_EQ(log->count("Exception in BT gatherData"), 2u);
}

// (A stop before any gathering schedules nothing: the accessories' end-to-end test without BlueZ.)
TEST_F(AnAudioRegistrationWorker, FirstStopOnlySchedulesWithinAWeek) {
    fake.bluetooth.addDevice("00:00:00:00:00:01", accessory("K1"), true);
    auto session = started();
    session->sendMessage(devices(kTriggerText));
    const double now = fake.clock.now();
    session->stop();
    EXPECT_EQ(storedDouble("AudioRegistrationNextInvocationEpoch"), now + 12345);
    EXPECT_TRUE(log->contains(
        fmt::format("Current Epoch: {:f}; nextInvocationEpoch is {:f}", now, now + 12345)));
    EXPECT_TRUE(fake.convo.sessions.empty()) << "nothing published at the first stop";

    // Not yet due (to the second): nothing; then due: published.
    fake.clock.setNow(now + 12345);
    session->start();
    session->stop();
    EXPECT_TRUE(fake.convo.sessions.empty());
    fake.clock.setNow(now + 12346);
    session->start();
    session->stop();
    EXPECT_EQ(sent().size(), 1u);
    // (That the real random source keeps within the first week: the accessories' end-to-end test.)
}

TEST_F(AnAudioRegistrationWorker, PublishesDevicesSeenInTheLastEightDaysAsWeekNumbers) {
    ScopedTimeZone utc("UTC0");
    const double now = fake.clock.now();  // Wednesday 31 January 2024, week 5
    storeRegistration({now - 691200, now - 691201, now - 3600});
    dueNow();
    started()->stop();

    // Exactly eight days ago is still active, one second more is not. (What the Convo session is
    // told: the accessories' end-to-end publication.)
    const auto messages = sent();
    ASSERT_EQ(messages.size(), 2u);
    EXPECT_EQ(messages[0].payload,
              (Dictionary{
                  {"AudioModelNumber", "M4801"}, {"AudioUUIDLeft", "L1"}, {"lastConnectedWW", 4}}));
    EXPECT_EQ(*messages[1].payload.find("AudioUUIDLeft"), Value("L3"));
    EXPECT_EQ(*messages[1].payload.find("lastConnectedWW"), Value(5));
    // Sent: the next publication is a week after the last send.
    EXPECT_EQ(storedDouble("AudioRegistrationNextInvocationEpoch"), now + 604800);
}

// A due stop that publishes nothing checks again in a week when no device was active, a day later
// when the publication failed, and not before the next trigger when it cannot read what it holds.
TEST_F(AnAudioRegistrationWorker, ReschedulesADueStopThatPublishesNothing) {
    const double now = fake.clock.now();
    const Value active = Array{Dictionary{{"lastConnectedEpoch", now}}};
    struct Case {
        const char* what;
        Value registration;  // the "splunk" list
        std::function<void(test::FakeConvoService&)> arrange;
        const char* logged;
        std::optional<double> next;  // the next check, from now
    };
    const Case cases[] = {
        {"no device active",
         Array{Dictionary{{"lastConnectedEpoch", now - 691201}},
               Dictionary{{"lastConnectedEpoch", 0}}},
         [](auto&) {},
         "No active Bud connections detected since last publish. Skip publishing anything; check "
         "again after SamplingPeriod",
         604800},
        {"no token", active, [](auto& c) { c.available = false; },
         "newHierarchyTokenFromParentToken returned nil. Will skip convo for this session. "
         "-[QVReportingSessionAudioRegistrationWorker setupConvoReporterInterface:]",
         86400},
        {"no backends", active, [](auto& c) { c.backends.reset(); },
         "no backends found, this session won't get sent to the server", 86400},
        {"send error", active, [](auto& c) { c.sendError = "the sink is full"; },
         "error sending message the sink is full", 86400},
        {"an entry that is no dictionary", Array{"not an entry"}, [](auto&) {},
         "Exception while trying to process registration info : a registration entry is not a "
         "dictionary",
         std::nullopt},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.what);
        Worker::TEST_resetSharedState();
        test::FakePlatform platform;
        c.arrange(platform.convo);
        platform.clock.setNow(now);
        platform.preferences.setValue(kSuite, "ELRegistrationInfo",
                                      Dictionary{{"splunk", c.registration}});
        platform.preferences.setValue(kSuite, "AudioRegistrationNextInvocationEpoch", now - 1);
        auto session = test::makeSession(platform.platform, {.pids = {1}, .start = true});
        session->stop();
        EXPECT_TRUE(log->contains(c.logged));
        if (c.next) {
            EXPECT_EQ(platform.preferences.value(kSuite, "AudioRegistrationNextInvocationEpoch"),
                      Value(now + *c.next));
        }
        if (c.next != 86400.0) {
            EXPECT_TRUE(platform.convo.sessions.empty()) << "nothing to publish";
        }
    }
}

TEST_F(AnAudioRegistrationWorker, SendsWhenTheBackendsAnswerAfterTheSessionIsGone) {
    fake.convo.holdCompletions = true;
    const double now = fake.clock.now();
    storeRegistration({now, now - 10});
    dueNow();
    {
        auto session = started();
        session->stop();
    }
    EXPECT_TRUE(sent().empty());
    // The service answers on a thread of its own while the server queue goes on.
    std::thread service([&] { fake.convo.completePending(std::vector<std::string>{"jsonl"}); });
    auto other = started(9);
    other->sendMessage(devices("no earbuds"));
    service.join();
    EXPECT_EQ(sent().size(), 2u);
    EXPECT_EQ(storedDouble("AudioRegistrationNextInvocationEpoch"), now + 604800);
}

TEST(AudioRegistrationWorkWeek, CountsSundayWeeksWithTheWeekOfFirstJanuaryAsWeekOne) {
    struct Case {
        const char* zone;
        std::uint32_t epoch;
        int week;
        const char* when;
    };
    const Case cases[] = {
        {"UTC0", 1641038400, 1, "Sat 2022-01-01 12:00 UTC"},
        {"UTC0", 1641124800, 2, "Sun 2022-01-02: a new week"},
        {"UTC0", 1640520000, 1, "Sun 2021-12-26: its week holds 1 January"},
        {"UTC0", 1640433600, 52, "Sat 2021-12-25"},
        {"UTC0", 1703937600, 52, "Sat 2023-12-30"},
        {"UTC0", 1704024000, 1, "Sun 2023-12-31: its week holds 1 January 2024"},
        {"UTC0", 1483185600, 53, "Sat 2016-12-31: 2016 has 53 weeks"},
        {"UTC0", 1483239600, 1, "Sun 2017-01-01 03:00 UTC"},
        {"EST5", 1483239600, 53, "the same instant is Sat 2016-12-31 22:00 in New York"},
        {"LINT-14", 1483185600, 1, "Sat 2016-12-31 12:00 UTC is Sun 2017-01-01 in Kiritimati"},
        {"UTC0", 0, 1, "Thu 1970-01-01"},
        {"UTC0", 4294967295u, 7, "Sun 2106-02-07, the last unsigned 32-bit second"},
    };
    for (const auto& c : cases) {
        ScopedTimeZone zone(c.zone);
        EXPECT_EQ(Worker::_convertEpochToWorkWeek(c.epoch), c.week) << c.when << " in " << c.zone;
    }
}

}  // namespace
}  // namespace qv
