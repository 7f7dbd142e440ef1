#include "monitoring/QVReportingSystemMonitor.h"

#include "monitoring/QVReportingSessionSystemMonitorWorker.h"
#include "session/SerialQueue.h"
#include "workers/WorkerTestSupport.h"

namespace qv {
namespace {

using test::FakePlatform;

constexpr std::string_view kSpatial = QVReportingMessageKeySpatialAudioAccessoryFeature;
constexpr std::string_view kRinger = QVReportingMessageKeyRingerState;
constexpr std::string_view kDeviceName = QVReportingMessageKeyDeviceName;

TEST(QVReportingDefaultsOfTheSuite, ReadOnlyTheirOwnKeysAsBooleanOrText) {
    FakePlatform fake;
    EXPECT_EQ(QVReportingDefaults(fake.preferences), (Dictionary{{"disable_reporting", false}}));
    fake.preferences.setValue("com.korvane.qvsound", "device_name", Value(5));  // not text
    fake.preferences.setValue("com.korvane.qvsound", "disable_reporting", Value(1));
    const Dictionary set = QVReportingDefaults(fake.preferences);
    EXPECT_EQ(set.find("disable_reporting")->kind(), Value::Kind::Bool);
    EXPECT_EQ(set, (Dictionary{{"disable_reporting", true}}));  // the name was no text
}

class ASystemMonitor : public ::testing::Test {
  protected:
    void SetUp() override { QVReportingSystemMonitor::reset(); }
    void TearDown() override {
        queue.sync([this] { session.reset(); });
        QVReportingSystemMonitor::reset();
        queue.sync([] {});
    }

    void initialize() { QVReportingSystemMonitor::initializeWithQueue(queue, fake.platform); }
    // Posts, then waits until the handler has run on the monitor's queue.
    void post(std::string_view name, std::uint64_t state) {
        fake.notifications.post(name, state);
        queue.sync([] {});
    }
    std::optional<Dictionary> stored(std::string_view feature) {
        return QVReportingSystemMonitor::getSystemMonitorDictionary()->valueForKey(feature);
    }
    // A session made and started on the queue, as the service does it.
    void startSession() {
        queue.sync([this] {
            session = QVReportingSession::initWithID(fake.platform, 77, {1234});
            session->start();
        });
    }
    // Payloads of the Setup / Setup messages the session holds, in order.
    std::vector<Dictionary> setupPayloads() {
        std::vector<Dictionary> payloads;
        queue.sync([&] {
            for (const auto& m : session->messages()) {
                if (m->category() == category::kSetup && m->type() == type::kSetup)
                    payloads.push_back(m->message());
            }
        });
        return payloads;
    }

    test::ScopedWorkerClasses<QVReportingSessionSystemMonitorWorker> workerClasses;
    FakePlatform fake;
    SerialQueue queue{"test.systemmonitor"};
    std::shared_ptr<QVReportingSession> session;
};

TEST_F(ASystemMonitor, ReadsItsFeaturesAtStartAndRegistersForEachInDeclaredOrder) {
    fake.preferences.setValue("com.korvane.deskhost", kSpatial, Value(true));
    fake.clock.setSystemUptime(1000.6);
    const double readTime = fake.clock.now();
    initialize();
    EXPECT_EQ(stored(kSpatial), (Dictionary{{std::string(kSpatial), true},
                                            {"qvreporting_timestamp", readTime},
                                            {"systemuptime_sec", 1001}}));
    // One monitor per process: a second initialisation changes nothing.
    const auto first = QVReportingSystemMonitor::shared();
    initialize();
    EXPECT_EQ(QVReportingSystemMonitor::shared(), first);

    QVReportingSystemMonitor::reset();  // registered in declared order, cancelled alike
    EXPECT_EQ(fake.notifications.cancelled, (std::vector<NotificationCenter::Token>{1, 2, 3}));
    EXPECT_FALSE(QVReportingSystemMonitor::getSystemMonitorDictionary());
}

TEST_F(ASystemMonitor, ReadsTheRingerAsOnOnlyForExactlyOneAndTellsObserversOfRealChanges) {
    initialize();
    std::vector<Dictionary> seen;  // written on the queue, read after post() returns
    QVReportingSystemMonitor::getSystemMonitorDictionary()->addObserver(
        std::string(kRinger), [&](const Dictionary& state) { seen.push_back(state); });
    const std::pair<std::uint64_t, bool> cases[] = {
        {1, true}, {0, false}, {2, false}, {0xFFFFFFFFFFFFFFFFull, false}, {1, true}};
    for (const auto& [state, on] : cases) {
        fake.clock.advance(1);
        post("com.korvane.deskhost.ringerstate", state);
        ASSERT_TRUE(stored(kRinger)) << state;
        EXPECT_EQ(stored(kRinger)->find(kRinger)->kind(), Value::Kind::Bool);
        EXPECT_EQ(*stored(kRinger)->find(kRinger), Value(on)) << state;
    }
    EXPECT_EQ(seen.size(), 5u);  // each read is later, and the state carries its read time
    post("com.korvane.deskhost.ringerstate", 1);  // same state, same read time: no change
    post("com.korvane.somethingelse", 1);
    EXPECT_EQ(seen.size(), 5u);
}

TEST_F(ASystemMonitor, GivesAStartedSessionOneUnstampedSetupMessagePerStateInDeclaredOrder) {
    fake.preferences.setValue("com.korvane.qvsound", "device_name", Value("Den"));
    fake.preferences.setValue("com.korvane.deskhost", kSpatial, Value(0));
    const double readTime = fake.clock.now();
    initialize();
    post("com.korvane.deskhost.ringerstate", 1);
    fake.clock.advance(30);
    startSession();
    const auto payloads = setupPayloads();
    ASSERT_EQ(payloads.size(), 3u);
    EXPECT_EQ(*payloads[0].find(kSpatial), Value(0));
    EXPECT_EQ(*payloads[1].find(kDeviceName), Value("Den"));
    EXPECT_EQ(*payloads[2].find(kRinger), Value(true));
    const Dictionary& p = payloads[0];
    EXPECT_EQ(*p.find("last_updated"), Value(readTime));
    EXPECT_FALSE(p.contains("systemuptime_sec"));
    // The session stamps what arrives without a time: proof that the worker sent none.
    EXPECT_EQ(*p.find("invalid_timestamp"), Value("nil"));
    EXPECT_EQ(*p.find("qvreporting_timestamp"), Value(readTime + 30));
}

TEST_F(ASystemMonitor, ForwardsChangesToARunningSessionAndNoneAfterItsWorkerStops) {
    initialize();
    startSession();
    EXPECT_TRUE(setupPayloads().empty());  // no state yet, no message
    fake.clock.advance(5);
    post("com.korvane.deskhost.ringerstate", 1);
    fake.preferences.setValue("com.korvane.qvsound", "device_name", Value("Kitchen"));
    fake.clock.advance(5);
    post("com.korvane.qvsound.reporting", 0);
    auto payloads = setupPayloads();
    ASSERT_EQ(payloads.size(), 2u);
    EXPECT_EQ(*payloads[0].find(kRinger), Value(true));
    EXPECT_EQ(*payloads[0].find("last_updated"), Value(fake.clock.now() - 5));
    EXPECT_EQ(*payloads[1].find(kDeviceName), Value("Kitchen"));

    auto dictionary = QVReportingSystemMonitor::getSystemMonitorDictionary();
    queue.sync([this] { session->stop(); });
    EXPECT_EQ(dictionary->observerCount(), 0u);
    post("com.korvane.deskhost.ringerstate", 0);
    EXPECT_EQ(*stored(kRinger)->find(kRinger), Value(false));
    EXPECT_TRUE(setupPayloads().empty());

    // Started again, it reports the current states afresh and observes again.
    queue.sync([this] { session->start(); });
    payloads = setupPayloads();
    ASSERT_EQ(payloads.size(), 2u);
    EXPECT_EQ(*payloads[1].find(kRinger), Value(false));
    EXPECT_EQ(dictionary->observerCount(), 3u);
    // A session that goes away without stopping takes its observers with it.
    queue.sync([this] { session.reset(); });
    EXPECT_EQ(dictionary->observerCount(), 0u);
}

}  // namespace
}  // namespace qv
