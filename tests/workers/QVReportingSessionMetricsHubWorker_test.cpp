#include "workers/backends/QVReportingSessionMetricsHubWorker.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <string>
#include <utility>
#include <vector>

#include "fakes/FakePlatform.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingWorkerRegistry.h"

namespace qv {
namespace {

using test::FakePlatform;

// An analytics service that keeps the producers and runs them only when the test says so, the
// way a backend may record an event after handleMessage has returned.
class DeferringAnalytics : public AnalyticsService {
  public:
    bool isEventUsed(std::string_view) const override { return true; }
    void sendEventLazy(std::string_view eventName, PayloadProducer producer) override {
        pending.emplace_back(std::string(eventName), std::move(producer));
    }
    std::vector<std::pair<std::string, PayloadProducer>> pending;
};

std::vector<std::string> keysOf(const Dictionary& dictionary) {
    std::vector<std::string> keys;
    for (const auto& entry : dictionary) {
        keys.push_back(entry.first);
    }
    return keys;
}

class AMetricsHubWorker : public ::testing::Test {
  protected:
    void SetUp() override {
        QVReportingWorkerRegistry::TEST_reset(
            {&makeWorkerClass<QVReportingSessionMetricsHubWorker>()});
    }
    void TearDown() override { QVReportingWorkerRegistry::TEST_reset({}); }

    std::shared_ptr<QVReportingSession> make(const Platform& platform, ReporterID id = 7) {
        return QVReportingSession::initWithID(platform, id, {1234});
    }
    static std::shared_ptr<QVReportingSessionMessage> message(Dictionary payload,
                                                              AudioEventCategory c,
                                                              AudioEventType t) {
        return std::make_shared<QVReportingSessionMessage>(std::move(payload), c, t);
    }
    std::vector<std::string> eventNames() const {
        std::vector<std::string> names;
        for (const auto& e : fake.analytics.events) {
            names.push_back(e.name);
        }
        return names;
    }

    FakePlatform fake;
};

TEST_F(AMetricsHubWorker, OffersEachMessageUnderTheQVSoundNameThenTheServiceName) {
    // Made with the session and serving single-message sessions: one instance before any start,
    // and it is not skipped when a single-message session starts.
    auto session = make(fake.platform);
    ASSERT_EQ(session->workerInstanceCount(), 1u);
    session->setIsSingleMessageSession(true);
    session->setServiceType(service::kTelephony);
    session->start();
    EXPECT_EQ(session->workerInstanceCount(), 1u);

    session->sendMessage(message({{"a", 1}}, category::kPlayback, type::kStart));
    session->sendMessage(message({{"b", 2}}, category::kPrefixDSP | category::kSetup, type::kStop));
    // Values outside the vocabulary are named as the vocabulary names them.
    session->sendMessage(message({{"c", 3}}, 0, type::kUnknown));
    session->sendMessage(message({{"d", 4}}, category::kVolume, 500));

    const std::vector<std::string> expected = {
        "com.korvane.qvsound.Playback.Start",    "com.korvane.telephony.Playback.Start",
        "com.korvane.qvsound.DSP_Setup.Stop",    "com.korvane.telephony.DSP_Setup.Stop",
        "com.korvane.qvsound.Undefined.Unknown", "com.korvane.telephony.Undefined.Unknown",
        "com.korvane.qvsound.Volume.Generic",    "com.korvane.telephony.Volume.Generic",
    };
    EXPECT_EQ(fake.analytics.queried, expected);
    EXPECT_EQ(eventNames(), expected);

    // A service type without a name is "unknown"; only a session that is gone leaves the part
    // empty.
    fake.analytics.queried.clear();
    auto unnamed = make(fake.platform, 8);
    unnamed->sendMessage(message({{"e", 5}}, category::kPlayback, type::kStart));
    EXPECT_EQ(fake.analytics.queried,
              (std::vector<std::string>{"com.korvane.qvsound.Playback.Start",
                                        "com.korvane.unknown.Playback.Start"}));

    fake.analytics.queried.clear();
    auto orphan = QVReportingSessionMetricsHubWorker::initWithSession(make(fake.platform, 9));
    ASSERT_TRUE(orphan);
    ASSERT_FALSE(orphan->session());
    orphan->handleMessage(message({{"f", 6}}, category::kPlayback, type::kStart));
    EXPECT_EQ(fake.analytics.queried,
              (std::vector<std::string>{"com.korvane.qvsound.Playback.Start",
                                        "com.korvane..Playback.Start"}));
}

TEST_F(AMetricsHubWorker, BuildsNoPayloadForANameNoOneUses) {
    auto session = make(fake.platform);
    session->setServiceType(service::kAlarms);
    fake.analytics.unused = {"com.korvane.qvsound.Error.Error", "com.korvane.alarms.Error.Error"};
    session->sendMessage(message({{"x", 1}}, category::kError, type::kError));
    EXPECT_EQ(fake.analytics.queried.size(), 2u) << "both names are still asked about";
    EXPECT_EQ(fake.analytics.producerCalls, 0);
    EXPECT_TRUE(fake.analytics.events.empty());

    // Only the second name in use: one event, under that name.
    fake.analytics.unused = {"com.korvane.qvsound.Error.Error"};
    session->sendMessage(message({{"x", 2}}, category::kError, type::kError));
    EXPECT_EQ(fake.analytics.producerCalls, 1);
    EXPECT_EQ(eventNames(), std::vector<std::string>{"com.korvane.alarms.Error.Error"});
}

TEST_F(AMetricsHubWorker, ForwardsThePayloadExactlyAsTheSessionHoldsIt) {
    auto session = make(fake.platform);
    auto sent = message({{"zz", std::numeric_limits<std::uint64_t>::max()},
                         {"aa", 0.30000000000000004},
                         {"nested", Dictionary{{"k", "v"}}},
                         {"raw", Bytes{1, 2, 3}}},
                        category::kRouteChange, type::kActivate);
    session->sendMessage(sent);
    const auto events = fake.analytics.events;
    ASSERT_EQ(events.size(), 2u);
    for (const auto& event : events) {
        SCOPED_TRACE(event.name);
        // The session's stamps are there, nothing else was added, and the order is kept.
        EXPECT_EQ(keysOf(event.payload), keysOf(sent->message()));
        EXPECT_EQ(event.payload, sent->message());
        EXPECT_EQ(event.payload.find("zz")->asUInt64(), std::numeric_limits<std::uint64_t>::max());
    }
    EXPECT_EQ(sent->message().find("zz")->asUInt64(), std::numeric_limits<std::uint64_t>::max())
        << "the message itself is left alone";
}

TEST_F(AMetricsHubWorker, GivesEachEventItsOwnCopyTakenWhenTheBackendAsks) {
    DeferringAnalytics analytics;
    const Platform platform{fake.clock,         fake.device, fake.process,  fake.preferences,
                            fake.notifications, analytics,   fake.condition};
    auto session = make(platform);
    session->setServiceType(service::kHaptics);
    auto sent = message({{"level", 3}}, category::kOutput, type::kSetup);
    session->sendMessage(sent);
    ASSERT_EQ(analytics.pending.size(), 2u);
    EXPECT_EQ(analytics.pending[0].first, "com.korvane.qvsound.Output.Setup");
    EXPECT_EQ(analytics.pending[1].first, "com.korvane.haptics.Output.Setup");

    // A later worker changes the message; the session and the caller then let go of it. The
    // producers still own it, and copy it as it is when they run.
    sent->message().set("added_later", true);
    const Dictionary expected = sent->message();
    std::weak_ptr<QVReportingSessionMessage> watch = sent;
    sent.reset();
    session.reset();
    EXPECT_FALSE(watch.expired());

    Dictionary first = analytics.pending[0].second();
    EXPECT_EQ(first, expected);
    first.set("level", 99);  // a backend may change its copy without touching the other event
    const Dictionary second = analytics.pending[1].second();
    EXPECT_EQ(second, expected);
    EXPECT_EQ(analytics.pending[0].second(), expected) << "every call makes a fresh copy";

    analytics.pending.clear();
    EXPECT_TRUE(watch.expired()) << "the message goes with the last producer";
}

}  // namespace
}  // namespace qv
