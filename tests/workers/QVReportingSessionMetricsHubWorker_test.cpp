#include "workers/backends/QVReportingSessionMetricsHubWorker.h"

#include <cstdint>
#include <limits>
#include <utility>

#include "workers/WorkerTestSupport.h"

namespace qv {
namespace {

using test::message;

// Keeps the producers and runs them when the test says, as a backend recording later would.
class DeferringAnalytics : public AnalyticsService {
  public:
    bool isEventUsed(std::string_view) const override { return true; }
    void sendEventLazy(std::string_view eventName, PayloadProducer producer) override {
        pending.emplace_back(std::string(eventName), std::move(producer));
    }
    std::vector<std::pair<std::string, PayloadProducer>> pending;
};

class AMetricsHubWorker : public ::testing::Test {
  protected:
    std::shared_ptr<QVReportingSession> make(const Platform& platform, ReporterID id = 7) {
        return QVReportingSession::initWithID(platform, id, {1234});
    }
    test::ScopedWorkerClasses<QVReportingSessionMetricsHubWorker> workerClasses;
    test::FakePlatform fake;
};

TEST_F(AMetricsHubWorker, OffersEachMessageUnchangedUnderTheQVSoundNameThenTheServiceName) {
    // It serves single-message sessions too: still there after such a session starts.
    auto session = make(fake.platform);
    session->setIsSingleMessageSession(true);
    session->setServiceType(service::kTelephony);
    session->start();
    EXPECT_EQ(session->workerInstanceCount(), 1u);

    auto exact = message({{"zz", std::numeric_limits<std::uint64_t>::max()},
                          {"aa", 0.30000000000000004},
                          {"raw", Bytes{1, 2, 3}}},
                         category::kPlayback, type::kStart);
    session->sendMessage(exact);
    session->sendMessage(message({{"b", 2}}, category::kPrefixDSP | category::kSetup, type::kStop));
    session->sendMessage(message({{"c", 3}}, 0, type::kUnknown));
    session->sendMessage(message({{"d", 4}}, category::kVolume, 500));
    const std::vector<std::string> expected = {
        "com.korvane.qvsound.Playback.Start",    "com.korvane.telephony.Playback.Start",
        "com.korvane.qvsound.DSP_Setup.Stop",    "com.korvane.telephony.DSP_Setup.Stop",
        "com.korvane.qvsound.Undefined.Unknown", "com.korvane.telephony.Undefined.Unknown",
        "com.korvane.qvsound.Volume.Generic",    "com.korvane.telephony.Volume.Generic",
    };
    EXPECT_EQ(fake.analytics.queried, expected);
    ASSERT_EQ(fake.analytics.events.size(), expected.size());
    for (std::size_t i = 0; i < 2; ++i) {
        EXPECT_EQ(fake.analytics.events[i].payload, exact->message()) << "same entries, same order";
    }

    // Names follow the kind and the service of each message, also when only one of them changes.
    fake.analytics.queried.clear();
    session->sendMessage(message({{"g", 7}}, category::kVolume, 500));
    session->sendMessage(message({{"h", 8}}, category::kPlayback, type::kStart));
    session->setServiceType(service::kHaptics);
    session->sendMessage(message({{"i", 9}}, category::kPlayback, type::kStart));
    EXPECT_EQ(fake.analytics.queried,
              (std::vector<std::string>{
                  "com.korvane.qvsound.Volume.Generic", "com.korvane.telephony.Volume.Generic",
                  "com.korvane.qvsound.Playback.Start", "com.korvane.telephony.Playback.Start",
                  "com.korvane.qvsound.Playback.Start", "com.korvane.haptics.Playback.Start"}));

    // A name no one uses gets no event; a service type without a name is "unknown"; a session
    // that is gone leaves the part empty.
    fake.analytics.queried.clear();
    fake.analytics.events.clear();
    fake.analytics.unused = {"com.korvane.qvsound.Playback.Start"};
    make(fake.platform, 8)->sendMessage(message({{"e", 5}}, category::kPlayback, type::kStart));
    auto orphan = QVReportingSessionMetricsHubWorker::initWithSession(make(fake.platform, 9));
    ASSERT_TRUE(orphan && !orphan->session());
    orphan->handleMessage(message({{"f", 6}}, category::kPlayback, type::kStart));
    EXPECT_EQ(fake.analytics.queried,
              (std::vector<std::string>{
                  "com.korvane.qvsound.Playback.Start", "com.korvane.unknown.Playback.Start",
                  "com.korvane.qvsound.Playback.Start", "com.korvane..Playback.Start"}));
    ASSERT_EQ(fake.analytics.events.size(), 2u);
    EXPECT_EQ(fake.analytics.events[0].name, "com.korvane.unknown.Playback.Start");
}

TEST_F(AMetricsHubWorker, GivesEachEventItsOwnCopyTakenWhenTheBackendAsks) {
    DeferringAnalytics analytics;
    const Platform platform = fake.with({.analytics = &analytics});
    auto session = make(platform);
    auto sent = message({{"level", 3}}, category::kOutput, type::kSetup);
    session->sendMessage(sent);
    ASSERT_EQ(analytics.pending.size(), 2u);

    // A later change is seen; the producers keep the message alive after everyone else lets go.
    sent->message().set("added_later", true);
    const Dictionary expected = sent->message();
    std::weak_ptr<QVReportingSessionMessage> watch = sent;
    sent.reset();
    session.reset();
    Dictionary first = analytics.pending[0].second();
    EXPECT_EQ(first, expected);
    first.set("level", 99);
    EXPECT_EQ(analytics.pending[1].second(), expected);
    EXPECT_EQ(analytics.pending[0].second(), expected) << "every call makes a fresh copy";
    analytics.pending.clear();
    EXPECT_TRUE(watch.expired()) << "the message goes with the last producer";
}

}  // namespace
}  // namespace qv
