#include "monitoring/QVReportingSystemMonitor.h"

#include <gtest/gtest.h>

#include <thread>

#include "fakes/FakePlatform.h"
#include "fakes/MemoryLogSink.h"
#include "monitoring/QVReportingSessionSystemMonitorWorker.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingWorkerRegistry.h"
#include "session/SerialQueue.h"

namespace qv {
namespace {

using test::FakePlatform;

constexpr std::string_view kSpatial = QVReportingMessageKeySpatialAudioAccessoryFeature;
constexpr std::string_view kRinger = QVReportingMessageKeyRingerState;
constexpr std::string_view kDeviceName = QVReportingMessageKeyDeviceName;

TEST(QVReportingDefaultsOfTheSuite, AreExactlyReportingEnabledForAnEmptySuite) {
    FakePlatform fake;
    const Dictionary empty = QVReportingDefaults(fake.preferences);
    ASSERT_EQ(empty, (Dictionary{{"disable_reporting", Value(false)}}));
    EXPECT_EQ(empty.find("disable_reporting")->kind(), Value::Kind::Bool);

    fake.preferences.setValue("com.korvane.qvsound", "device_name", Value("Den"));
    fake.preferences.setValue("com.korvane.qvsound", "disable_reporting", Value(1));
    fake.preferences.setValue("com.korvane.qvsound", "unrelated", Value("x"));
    const Dictionary set = QVReportingDefaults(fake.preferences);
    EXPECT_EQ(set, (Dictionary{{"device_name", Value("Den")}, {"disable_reporting", Value(true)}}));
    EXPECT_EQ(set.find("disable_reporting")->kind(), Value::Kind::Bool);

    // Values read as booleans read them; a device name must be text.
    fake.preferences.setValue("com.korvane.qvsound", "disable_reporting", Value("NO"));
    fake.preferences.setValue("com.korvane.qvsound", "device_name", Value(5));
    EXPECT_EQ(QVReportingDefaults(fake.preferences),
              (Dictionary{{"disable_reporting", Value(false)}}));
}

class ASystemMonitor : public ::testing::Test {
  protected:
    void SetUp() override {
        QVReportingSystemMonitor::reset();
        QVReportingWorkerRegistry::TEST_reset(
            {&makeWorkerClass<QVReportingSessionSystemMonitorWorker>()});
    }
    void TearDown() override {
        drain();
        queue.sync([this] { session.reset(); });
        QVReportingSystemMonitor::reset();
        drain();
        QVReportingWorkerRegistry::TEST_reset({});
    }

    void initialize() { QVReportingSystemMonitor::initializeWithQueue(queue, fake.platform); }
    // Waits until every handler posted so far has run on the monitor's queue.
    void drain() {
        queue.sync([] {});
    }
    void post(std::string_view name, std::uint64_t state) {
        fake.notifications.post(name, state);
        drain();
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
    void stopSession() {
        queue.sync([this] { session->stop(); });
    }
    // Payloads of the Setup / Setup messages the session holds, in order.
    std::vector<Dictionary> setupPayloads() {
        std::vector<Dictionary> payloads;
        queue.sync([&] {
            for (const auto& m : session->messages()) {
                if (m->category() == category::kSetup && m->type() == type::kSetup) {
                    payloads.push_back(m->message());
                }
            }
        });
        return payloads;
    }
    std::size_t storedMessageCount() {
        std::size_t n = 0;
        queue.sync([&] { n = session->messages().size(); });
        return n;
    }

    FakePlatform fake;
    SerialQueue queue{"test.systemmonitor"};
    std::shared_ptr<QVReportingSession> session;
};

TEST_F(ASystemMonitor, ReadsItsFeaturesAtStartAndRegistersForEachNotificationInOrder) {
    test::ScopedMemoryLog log;
    fake.preferences.setValue("com.korvane.deskhost", kSpatial, Value(true));
    fake.clock.setSystemUptime(1000.6);
    const double readTime = fake.clock.now();
    initialize();

    EXPECT_EQ(QVReportingSystemMonitor::getSystemMonitorKeys(),
              (std::vector<std::string>{std::string(kSpatial), "device_name", "ringerstate"}));
    // The ringer has no token yet while values are first read, and no device name is set.
    const Dictionary all = QVReportingSystemMonitor::getSystemMonitorDictionary()->snapshot();
    ASSERT_EQ(all.size(), 1u);
    const auto spatial = stored(kSpatial);
    ASSERT_TRUE(spatial);
    EXPECT_EQ(*spatial, (Dictionary{{std::string(kSpatial), Value(true)},
                                    {"qvreporting_timestamp", Value(readTime)},
                                    {"systemuptime_sec", Value(1001)}}));
    EXPECT_EQ(spatial->find("systemuptime_sec")->kind(), Value::Kind::Int);

    const Dictionary features = QVReportingSystemMonitor::shared()->features();
    const auto descriptor = [&](std::string_view name) {
        return *features.find(name)->asDictionary();
    };
    EXPECT_EQ(descriptor(kSpatial),
              (Dictionary{{"defaults_domain", Value("com.korvane.deskhost")},
                          {"feature_domain", Value(kSpatial)},
                          {"notification",
                           Value("com.korvane.deskhost.spatial-audio-accessory-feature.changed")},
                          {"notify_token", Value(1)}}));
    EXPECT_EQ(descriptor(kDeviceName),
              (Dictionary{{"defaults_domain", Value("com.korvane.qvsound")},
                          {"feature_domain", Value("device_name")},
                          {"notification", Value("com.korvane.qvsound.reporting")},
                          {"notify_token", Value(2)}}));
    EXPECT_EQ(descriptor(kRinger),
              (Dictionary{{"feature_domain", Value("ringerstate")},
                          {"notification", Value("com.korvane.deskhost.ringerstate")},
                          {"notify_token", Value(3)}}));

    EXPECT_TRUE(log->contains("populateInitialValues {"));
    EXPECT_TRUE(log->contains("listening for features {"));
    EXPECT_EQ(log->count("notify setup result 0 token "), 3u);
    EXPECT_TRUE(log->contains("notify setup result 0 token 3"));

    // One monitor per process: a second initialisation changes nothing.
    const auto first = QVReportingSystemMonitor::shared();
    initialize();
    EXPECT_EQ(QVReportingSystemMonitor::shared(), first);
    EXPECT_FALSE(first->getFeatureState("no-such-feature"));
    EXPECT_FALSE(first->getFeatureState(""));
    EXPECT_EQ(first->getDefaults(), (Dictionary{{"disable_reporting", Value(false)}}));
}

TEST_F(ASystemMonitor, ReadsTheRingerAsOnOnlyForAStateOfExactlyOne) {
    test::ScopedMemoryLog log;
    initialize();
    EXPECT_FALSE(stored(kRinger));
    const std::pair<std::uint64_t, bool> cases[] = {
        {1, true}, {0, false}, {2, false}, {0xFFFFFFFFFFFFFFFFull, false}, {1, true}};
    for (const auto& [state, on] : cases) {
        fake.clock.advance(1);
        post("com.korvane.deskhost.ringerstate", state);
        const auto ringer = stored(kRinger);
        ASSERT_TRUE(ringer) << state;
        EXPECT_EQ(*ringer->find(kRinger), Value(on)) << state;
        EXPECT_EQ(ringer->find(kRinger)->kind(), Value::Kind::Bool);
        EXPECT_EQ(*ringer->find("qvreporting_timestamp"), Value(fake.clock.now()));
    }
    EXPECT_TRUE(log->contains("feature changes featureName=ringerstate token=3"));
}

TEST_F(ASystemMonitor, TellsObserversOnlyWhenAFreshReadDiffersFromTheStoredState) {
    initialize();
    auto dictionary = QVReportingSystemMonitor::getSystemMonitorDictionary();
    std::vector<Dictionary> seen;  // written on the queue, read after drain()
    dictionary->addObserver(std::string(kRinger),
                            [&](const Dictionary& state) { seen.push_back(state); });
    dictionary->addObserver(std::string(kSpatial), [&](const Dictionary&) { ADD_FAILURE(); });

    post("com.korvane.deskhost.ringerstate", 1);
    // Same state, same read time: the whole dictionary is equal, so nothing changes.
    post("com.korvane.deskhost.ringerstate", 1);
    ASSERT_EQ(seen.size(), 1u);
    // Same state read later is a change, because the state carries its read time.
    fake.clock.advance(0.25);
    post("com.korvane.deskhost.ringerstate", 1);
    ASSERT_EQ(seen.size(), 2u);
    EXPECT_EQ(*seen[1].find("qvreporting_timestamp"), Value(fake.clock.now()));
    // A name nobody registered for touches no feature.
    post("com.korvane.somethingelse", 1);
    EXPECT_EQ(seen.size(), 2u);
}

TEST_F(ASystemMonitor, OnlyLogsAFailedRegistrationAndNeverUpdatesThatFeature) {
    test::ScopedMemoryLog log;
    fake.preferences.setValue("com.korvane.qvsound", "device_name", Value("Den"));
    fake.notifications.failRegistrations = true;
    initialize();
    EXPECT_EQ(log->count("notify setup result 1 token -1"), 3u);
    EXPECT_TRUE(stored(kDeviceName));
    for (const auto& [name, value] : QVReportingSystemMonitor::shared()->features()) {
        EXPECT_FALSE(value.asDictionary()->contains("notify_token")) << name;
    }
    post("com.korvane.deskhost.ringerstate", 1);
    EXPECT_FALSE(stored(kRinger));
}

TEST_F(ASystemMonitor, CancelsItsRegistrationsWhenReset) {
    initialize();
    auto dictionary = QVReportingSystemMonitor::getSystemMonitorDictionary();
    QVReportingSystemMonitor::reset();
    EXPECT_EQ(fake.notifications.cancelled, (std::vector<NotificationCenter::Token>{1, 2, 3}));
    EXPECT_FALSE(QVReportingSystemMonitor::shared());
    EXPECT_FALSE(QVReportingSystemMonitor::getSystemMonitorDictionary());
    EXPECT_TRUE(QVReportingSystemMonitor::getSystemMonitorKeys().empty());
    post("com.korvane.deskhost.ringerstate", 1);
    EXPECT_FALSE(dictionary->valueForKey(kRinger));
}

TEST_F(ASystemMonitor, GivesAStartedSessionOneUnstampedSetupMessagePerStateInDeclaredOrder) {
    const QVReportingWorkerClass& cls = makeWorkerClass<QVReportingSessionSystemMonitorWorker>();
    EXPECT_FALSE(cls.startOnInit || cls.handleSingleMessageSession);
    // Without a monitor in the process the worker does not apply.
    startSession();
    queue.sync([this] {
        EXPECT_TRUE(session->messageWorkers().empty());
        EXPECT_FALSE(QVReportingSessionSystemMonitorWorker::initWithSession(session));
        session.reset();
    });

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
    EXPECT_EQ(*p.find("audiotag"), Value("SetupSetup"));
}

TEST_F(ASystemMonitor, ForwardsChangesToARunningSessionAndNoneAfterItsWorkerStops) {
    initialize();
    startSession();
    EXPECT_TRUE(setupPayloads().empty());

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
    EXPECT_EQ(*payloads[1].find("last_updated"), Value(fake.clock.now()));

    auto dictionary = QVReportingSystemMonitor::getSystemMonitorDictionary();
    EXPECT_EQ(dictionary->observerCount(), 3u);
    stopSession();
    EXPECT_EQ(dictionary->observerCount(), 0u);
    // The monitor still follows the ringer, but the stopped session hears nothing of it.
    fake.clock.advance(5);
    post("com.korvane.deskhost.ringerstate", 0);
    EXPECT_EQ(*stored(kRinger)->find(kRinger), Value(false));
    EXPECT_EQ(storedMessageCount(), 0u);

    // Started again, it reports the current states afresh and observes again.
    queue.sync([this] { session->start(); });
    payloads = setupPayloads();
    ASSERT_EQ(payloads.size(), 2u);
    EXPECT_EQ(*payloads[0].find(kDeviceName), Value("Kitchen"));
    EXPECT_EQ(*payloads[1].find(kRinger), Value(false));
    EXPECT_EQ(dictionary->observerCount(), 3u);

    // A session that goes away without stopping takes its observers with it.
    queue.sync([this] { session.reset(); });
    EXPECT_EQ(dictionary->observerCount(), 0u);
}

TEST_F(ASystemMonitor, DeliversTheLastOfManyConcurrentPostsToTheSession) {
    initialize();
    startSession();
    std::vector<std::thread> posters;
    for (int t = 0; t < 3; ++t) {
        posters.emplace_back([&, t] {
            for (int i = 0; i < 50; ++i) {
                fake.clock.advance(0.001);
                fake.notifications.post("com.korvane.deskhost.ringerstate",
                                        static_cast<std::uint64_t>((t + i) % 3));
            }
        });
    }
    for (auto& poster : posters) {
        poster.join();
    }
    fake.clock.advance(1);
    post("com.korvane.deskhost.ringerstate", 1);
    const auto payloads = setupPayloads();
    ASSERT_FALSE(payloads.empty());
    for (const auto& p : payloads) {
        EXPECT_TRUE(p.contains(kRinger));
    }
    EXPECT_EQ(*payloads.back().find(kRinger), Value(true));
    EXPECT_EQ(*payloads.back().find("last_updated"), Value(fake.clock.now()));
}

TEST(ASystemMonitorWorkerMessage, MovesTheReadTimeToLastUpdatedAndSendsNothingForNoState) {
    EXPECT_FALSE(QVReportingSessionSystemMonitorWorker::messageForState(std::nullopt));
    EXPECT_FALSE(QVReportingSessionSystemMonitorWorker::messageForState(Dictionary{}));

    const auto m = QVReportingSessionSystemMonitorWorker::messageForState(
        Dictionary{{"ringerstate", Value(true)},
                   {"qvreporting_timestamp", Value(1700000000.5)},
                   {"systemuptime_sec", Value(12)}});
    ASSERT_TRUE(m);
    EXPECT_EQ(m->category(), category::kSetup);
    EXPECT_EQ(m->type(), type::kSetup);
    EXPECT_EQ(m->message(),
              (Dictionary{{"ringerstate", Value(true)}, {"last_updated", Value(1700000000.5)}}));

    // Without a read time the state goes as it is, uptime included.
    const auto bare = QVReportingSessionSystemMonitorWorker::messageForState(
        Dictionary{{"x", Value(1)}, {"systemuptime_sec", Value(3)}});
    ASSERT_TRUE(bare);
    EXPECT_EQ(bare->message(), (Dictionary{{"x", Value(1)}, {"systemuptime_sec", Value(3)}}));
}

}  // namespace
}  // namespace qv
