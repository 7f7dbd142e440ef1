#include "service/QVReportingService.h"

#include <gtest/gtest.h>

#include "fakes/FakePlatform.h"
#include "fakes/MemoryLogSink.h"
#include "session/QVReportingUtility.h"
#include "session/QVReportingWorkerRegistry.h"

namespace qv {
namespace {

using test::FakePlatform;

// What a reply said, once it said anything.
struct Answer {
    bool replied = false;
    int count = 0;
    std::optional<QVReportingError> error;
    bool result = false;
};

QVReportingClientServerInstance::BoolReply into(Answer& a) {
    return [&a](const std::optional<QVReportingError>& e, bool r) {
        a.replied = true;
        ++a.count;
        a.error = e;
        a.result = r;
    };
}

class AService : public ::testing::Test {
  protected:
    void SetUp() override {
        QVReportingWorkerRegistry::TEST_reset({});
        QVReportingUtilityTEST_resetInternalBuild();
        fake.process.names = {{100, "player"}, {200, "recorder"}};
    }
    void TearDown() override {
        service.reset();
        QVReportingWorkerRegistry::TEST_reset({});
        QVReportingUtilityTEST_resetInternalBuild();
    }

    void makeService(QVReportingLimits limits = {}) {
        service = std::make_unique<QVReportingService>(
            fake.platform, queue, limits,
            [this](std::chrono::duration<double> interval, std::function<void()> tick) {
                EXPECT_DOUBLE_EQ(interval.count(), 0.5);
                ++timersMade;
                reaperTick = std::move(tick);
                return std::make_unique<RepeatingTimer>(std::chrono::hours(24), [] {});
            });
    }
    void drain() {
        queue.sync([] {});
    }
    // Fires the reaper as its timer would, and waits for the reap on the queue.
    void tick() {
        ASSERT_TRUE(reaperTick);
        reaperTick();
        drain();
    }
    std::shared_ptr<QVReportingClientServerInstance> connect(std::int64_t pid) {
        auto c = service->acceptConnection(pid);
        drain();
        return c;
    }
    std::shared_ptr<QVReportingSession> startedSession(QVReportingClientServerInstance& c,
                                                       ReporterID id, Answer& start) {
        Answer created;
        c.createReportingSession(id, into(created));
        c.startReportingSessionForID(id, into(start));
        drain();
        return c.findReportingSessionForID(id, false);
    }
    void send(QVReportingClientServerInstance& c, Dictionary payload,
              std::vector<ReporterID> ids = {}) {
        c.sendMessage(std::move(payload), category::kPlayback, type::kStart, std::move(ids),
                      [this](const std::optional<QVReportingError>& e) { lastSendError = e; });
        drain();
    }
    static bool holds(const QVReportingSession& s, std::string_view key) {
        for (const auto& m : s.messages()) {
            if (m->message().contains(key))
                return true;
        }
        return false;
    }

    FakePlatform fake;
    SerialQueue queue{"test.server"};
    std::unique_ptr<QVReportingService> service;
    std::function<void()> reaperTick;
    int timersMade = 0;
    std::optional<QVReportingError> lastSendError;
};

TEST_F(AService, SendsMessagesWithoutIDsToEveryStartedSessionOfEveryClient) {
    makeService();
    auto a = connect(100), b = connect(200);
    Answer sa, sb;
    auto s1 = startedSession(*a, 11, sa), s2 = startedSession(*b, 22, sb);
    send(*b, {{"broadcast", 1}});
    EXPECT_TRUE(holds(*s1, "broadcast"));
    EXPECT_TRUE(holds(*s2, "broadcast"));
    EXPECT_EQ(service->singleMessageSession(), nullptr);
    // Named IDs reach only those sessions, across clients; 0 and unknown IDs are skipped.
    send(*a, {{"addressed", 1}}, {0, 22, 999});
    EXPECT_FALSE(holds(*s1, "addressed"));
    EXPECT_TRUE(holds(*s2, "addressed"));
    send(*a, {{"lost", 1}}, {999});
    EXPECT_FALSE(holds(*s1, "lost") || holds(*s2, "lost"));
    EXPECT_EQ(service->singleMessageSession(), nullptr);
    EXPECT_FALSE(lastSendError);
}

TEST_F(AService, RunsTheSingleMessageSessionFromFirstUseUntilMoreThanFiveIdleSeconds) {
    test::ScopedMemoryLog log;
    makeService();
    auto a = connect(100);
    send(*a, {{"first", 1}});
    auto single = service->singleMessageSession();
    ASSERT_TRUE(single);
    EXPECT_EQ(single->reporterID(), 1);
    EXPECT_EQ(single->serviceType(), service::kStandalone);
    EXPECT_TRUE(single->isSingleMessageSession());
    EXPECT_TRUE(single->started());
    EXPECT_EQ(single->processIdentifiers(), std::vector<std::int64_t>{4242});
    EXPECT_EQ(*single->configuration().find("HostApplicationDisplayID"), Value("Unknown"));
    EXPECT_TRUE(holds(*single, "first"));

    fake.clock.advance(3.0);
    tick();
    send(*a, {{"second", 1}});
    EXPECT_EQ(service->singleMessageSession(), single);  // reused
    fake.clock.advance(5.0);
    tick();
    EXPECT_EQ(service->singleMessageSession(), single);  // exactly the timeout is not yet idle
    EXPECT_TRUE(
        log->contains("Not stopping singleMessageSession. elapsed=5.000000 timeout=5.000000"));
    fake.clock.advance(0.5);
    tick();
    EXPECT_EQ(service->singleMessageSession(), nullptr);
    EXPECT_FALSE(single->started());  // stopped, so its workers flushed
    EXPECT_TRUE(log->contains("Stopping singleMessageSession after timeout=5.000000"));
    EXPECT_EQ(timersMade, 1);

    send(*a, {{"third", 1}});
    ASSERT_TRUE(service->singleMessageSession());
    EXPECT_NE(service->singleMessageSession(), single);
    EXPECT_EQ(timersMade, 2);
}

TEST_F(AService, HoldsTheStartReplyUntilTheSessionStops) {
    makeService();
    auto a = connect(100);
    Answer first, second, stopped;
    auto s = startedSession(*a, 5, first);
    EXPECT_TRUE(s->started());
    EXPECT_FALSE(first.replied);
    a->startReportingSessionForID(5, into(second));  // already started: never answered
    drain();
    a->stopReportingSessionForID(5, into(stopped));
    drain();
    EXPECT_TRUE(first.replied);
    EXPECT_TRUE(first.result);
    EXPECT_FALSE(second.replied);
    EXPECT_TRUE(stopped.result);

    // Unknown and zero IDs answer at once.
    Answer unknown, zero;
    a->startReportingSessionForID(77, into(unknown));
    a->startReportingSessionForID(0, into(zero));
    drain();
    EXPECT_TRUE(unknown.replied && zero.replied);
}

TEST_F(AService, OnInternalBuildsAnswersATestSessionsStartAtOnceAndMarksSingleMessages) {
    fake.device.internalBuild = true;
    makeService();
    auto a = connect(100);
    Answer created, typed, start, stop;
    a->createReportingSession(8, into(created));
    a->setServiceType(service::kTest, 8, into(typed));
    a->startReportingSessionForID(8, into(start));
    drain();
    EXPECT_EQ(start.count, 1);
    a->stopReportingSessionForID(8, into(stop));
    drain();
    EXPECT_EQ(start.count, 1);

    send(*a, {{"k", 1}});
    ASSERT_TRUE(service->singleMessageSession());
    EXPECT_TRUE(holds(*service->singleMessageSession(), "sendSingleMessage"));
}

TEST_F(AService, ReplacesTheSessionOnANewServiceTypeKeepingConfigurationAndPreviousValues) {
    makeService();
    auto a = connect(100);
    Answer ignored;
    a->createReportingSession(3, into(ignored));
    a->setServiceType(service::kGeneric, 3, into(ignored));
    a->setConfiguration({{"KXHostApplicationDisplayID", "com.example.app"}}, 3, into(ignored));
    drain();
    auto before = a->findReportingSessionForID(3, false);
    send(*a, {{"volume", 0.5}}, {3});
    a->setServiceType(service::kGeneric, 3, into(ignored));  // same type: same object
    drain();
    EXPECT_EQ(a->findReportingSessionForID(3, false), before);
    a->setServiceType(service::kHaptics, 3, into(ignored));
    drain();
    auto after = a->findReportingSessionForID(3, false);
    ASSERT_NE(after, before);
    EXPECT_EQ(after->serviceType(), service::kHaptics);
    EXPECT_TRUE(after->messages().empty());
    EXPECT_FALSE(after->started());
    EXPECT_EQ(*after->configuration().find("HostApplicationDisplayID"), Value("com.example.app"));
    EXPECT_EQ(*after->previousValues().find("volume"), Value(0.5));
    EXPECT_EQ(a->reporterIDs(), std::vector<ReporterID>{3});

    std::optional<AudioServiceType> type;
    a->getServiceNameForReporterID(3, [&](auto, AudioServiceType t) { type = t; });
    drain();
    EXPECT_EQ(type, service::kHaptics);
    a->getServiceNameForReporterID(0, [&](auto, AudioServiceType t) { type = t; });
    drain();
    EXPECT_EQ(type, service::kUnknown);
}

TEST_F(AService, ValidatesIDsAcrossClientsButStartsOnlyTheCallersOwn) {
    makeService();
    auto a = connect(100), b = connect(200);
    Answer ignored, start;
    a->createReportingSession(50, into(ignored));
    a->setServiceType(service::kAlarms, 50, into(ignored));
    drain();
    Dictionary valid, invalid;
    b->reporterIDValid(50, [&](auto, const Dictionary& d) { valid = d; });
    b->reporterIDValid(51, [&](auto, const Dictionary& d) { invalid = d; });
    b->startReportingSessionForID(50, into(start));
    drain();
    EXPECT_EQ(*valid.find("reporterID"), Value(50));
    EXPECT_EQ(*valid.find("serviceType"), Value(4));
    EXPECT_EQ(*invalid.find("reporterID"), Value(0));
    EXPECT_EQ(*invalid.find("serviceType"), Value(65535));
    EXPECT_TRUE(start.replied);  // answered as unknown
    EXPECT_FALSE(a->findReportingSessionForID(50, false)->started());

    b->createReportingSession(60, into(ignored));
    a->createReportingSession(40, into(ignored));
    std::vector<ReporterID> all;
    b->getAllReporters([&](auto, const std::vector<ReporterID>& ids) { all = ids; });
    drain();
    EXPECT_EQ(all, (std::vector<ReporterID>{50, 40, 60}));

    Answer destroyed;
    b->destroyReportingSession(50, into(destroyed));  // not b's: nothing happens
    a->destroyReportingSession(50, into(destroyed));
    drain();
    EXPECT_EQ(a->reporterIDs(), std::vector<ReporterID>{40});
    EXPECT_TRUE(destroyed.result);
}

TEST_F(AService, StopsADisconnectedClientsSessionsAndRecordsItsUptime) {
    test::ScopedMemoryLog log;
    makeService();
    auto a = connect(100), b = connect(300);  // 300 has no readable name
    Answer start;
    auto s = startedSession(*a, 9, start);
    fake.clock.advance(42.5);
    service->connectionInvalidated(a);
    service->connectionInvalidated(b);
    drain();
    EXPECT_FALSE(s->started());
    EXPECT_TRUE(a->reporterIDs().empty());
    EXPECT_EQ(service->getAllClients().size(), 0u);
    const auto events = fake.analytics.eventsNamed("com.korvane.qvsound.qvreportingclientuptime");
    ASSERT_EQ(events.size(), 1u);
    EXPECT_EQ(*events[0].payload.find("processName"), Value("player"));
    EXPECT_EQ(*events[0].payload.find("seconds"), Value(42.5));
    EXPECT_TRUE(
        log->contains("invalidationHandler: connection exited process=player uptime_sec=42"));
    EXPECT_TRUE(log->contains("clientProcessName is nil. clientpid=300"));
    EXPECT_TRUE(log->contains("removing 100 from the server client list"));
}

TEST_F(AService, RefusesMessagesWhileReportingIsDisabled) {
    makeService();
    auto a = connect(100);
    Answer start;
    startedSession(*a, 1234, start);
    service->setReportingEnabled(false);
    send(*a, {{"k", 1}});
    ASSERT_TRUE(lastSendError);
    EXPECT_EQ(lastSendError->name, "com.korvane.audio.reporting.ReportingDisabled");
    EXPECT_NE(lastSendError->message.find("code 1"), std::string::npos);
    EXPECT_EQ(service->findReportingSessionForID(1234), nullptr);
}

TEST_F(AService, EnforcesItsClientAndSessionLimitsAndCountsThem) {
    QVReportingStats::shared().TEST_reset();
    QVReportingLimits limits;
    limits.maxClients = 1;
    limits.maxSessionsPerClient = 2;
    makeService(limits);
    auto a = connect(100);
    EXPECT_EQ(connect(200), nullptr);
    Answer one, two, three, again;
    a->createReportingSession(1, into(one));
    a->createReportingSession(2, into(two));
    a->createReportingSession(3, into(three));
    a->createReportingSession(2, into(again));  // a replacement is not a new session
    drain();
    EXPECT_TRUE(one.result && two.result && again.result);
    ASSERT_TRUE(three.error);
    EXPECT_EQ(three.error->name, "org.freedesktop.DBus.Error.LimitsExceeded");
    EXPECT_EQ(QVReportingStats::shared().limitExceededCount(QVReportingStats::Limit::Clients), 1u);
    EXPECT_EQ(
        QVReportingStats::shared().limitExceededCount(QVReportingStats::Limit::SessionsPerClient),
        1u);
}

TEST_F(AService, EndsTheProcessWithStatusTwoOnKillService) {
    makeService();
    auto a = connect(100);
    int status = -1;
    QVReportingClientServerInstance::setExitHook([&](int s) { status = s; });
    a->killService();
    QVReportingClientServerInstance::setExitHook(nullptr);
    EXPECT_EQ(status, 2);
}

}  // namespace
}  // namespace qv
