#include "service/QVReportingService.h"

#include <gtest/gtest.h>

#include "fakes/FakePlatform.h"
#include "fakes/MemoryLogSink.h"
#include "session/QVReportingUtility.h"
#include "session/QVReportingWorkerRegistry.h"

namespace qv {
namespace {

struct Answer {
    int count = 0;
    std::optional<QVReportingError> error;
    bool result = false;
};

QVReportingClientServerInstance::BoolReply into(Answer& a) {
    return [&a](const std::optional<QVReportingError>& e, bool r) {
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
                                                       ReporterID id, Answer* start = nullptr) {
        c.createReportingSession(id, into(ignored));
        c.startReportingSessionForID(id, into(start ? *start : ignored));
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

    test::FakePlatform fake;
    SerialQueue queue{"test.server"};
    std::unique_ptr<QVReportingService> service;
    std::function<void()> reaperTick;
    int timersMade = 0;
    std::optional<QVReportingError> lastSendError;
    Answer ignored;
};

TEST_F(AService, RunsTheSingleMessageSessionFromFirstUseUntilMoreThanFiveIdleSeconds) {
    makeService();
    auto a = connect(100);
    send(*a, {{"first", 1}});
    auto single = service->singleMessageSession();
    ASSERT_TRUE(single);
    EXPECT_TRUE(single->isSingleMessageSession() && single->started());

    fake.clock.advance(3.0);
    tick();
    send(*a, {{"second", 1}});  // use restarts the idle time
    fake.clock.advance(5.0);
    tick();
    EXPECT_EQ(service->singleMessageSession(), single);  // exactly the timeout is not yet idle
    fake.clock.advance(0.5);
    tick();
    EXPECT_EQ(service->singleMessageSession(), nullptr);
    EXPECT_FALSE(single->started());  // stopped, so its workers flushed
    send(*a, {{"third", 1}});
    EXPECT_NE(service->singleMessageSession(), single);
    EXPECT_EQ(timersMade, 2);  // the reaper's timer lives as long as the session
}

TEST_F(AService, HoldsTheStartReplyUntilItsSessionStopsOrGoesAway) {
    makeService();
    auto a = connect(100);
    using End = std::function<void(QVReportingClientServerInstance&)>;
    const std::vector<std::pair<const char*, End>> ends = {
        {"stop", [&](auto& c) { c.stopReportingSessionForID(5, into(ignored)); }},
        {"destroy", [&](auto& c) { c.destroyReportingSession(5, into(ignored)); }},
        {"create again", [&](auto& c) { c.createReportingSession(5, into(ignored)); }},
        {"new service type",
         [&](auto& c) { c.setServiceType(service::kAlarms, 5, into(ignored)); }},
    };
    for (const auto& [name, end] : ends) {
        SCOPED_TRACE(name);
        Answer first, second;
        auto s = startedSession(*a, 5, &first);
        EXPECT_TRUE(s->started());
        a->startReportingSessionForID(5, into(second));  // already started: never answered
        drain();
        EXPECT_EQ(first.count, 0);
        end(*a);
        drain();
        EXPECT_EQ(first.count, 1);
        EXPECT_TRUE(first.result);
        EXPECT_EQ(second.count, 0);
        a->destroyReportingSession(5, into(ignored));
        drain();
        EXPECT_EQ(first.count, 1) << "answered once";
    }
}

TEST_F(AService, OnInternalBuildsAnswersATestSessionsStartAtOnceAndMarksSingleMessages) {
    fake.device.internalBuild = true;
    makeService();
    auto a = connect(100);
    Answer start;
    a->createReportingSession(8, into(ignored));
    a->setServiceType(service::kTest, 8, into(ignored));
    a->startReportingSessionForID(8, into(start));
    a->stopReportingSessionForID(8, into(ignored));
    drain();
    EXPECT_EQ(start.count, 1);  // answered at the start, not again at the stop
    send(*a, {{"k", 1}});
    ASSERT_TRUE(service->singleMessageSession());
    EXPECT_TRUE(holds(*service->singleMessageSession(), "sendSingleMessage"));
}

TEST_F(AService, ReplacesTheSessionOnANewServiceTypeKeepingConfigurationAndPreviousValues) {
    makeService();
    auto a = connect(100);
    a->createReportingSession(3, into(ignored));
    a->setServiceType(service::kGeneric, 3, into(ignored));
    a->setConfiguration({{"KXHostApplicationDisplayID", "com.example.app"}}, 3, into(ignored));
    drain();
    auto before = a->findReportingSessionForID(3, false);
    send(*a, {{"volume", 0.5}}, {3});
    a->setServiceType(service::kHaptics, 3, into(ignored));
    drain();
    auto after = a->findReportingSessionForID(3, false);
    ASSERT_NE(after, before);
    EXPECT_EQ(after->clientProcessName(), "player");
    EXPECT_TRUE(after->messages().empty());
    EXPECT_EQ(*after->configuration().find("HostApplicationDisplayID"), Value("com.example.app"));
    EXPECT_EQ(*after->previousValues().find("volume"), Value(0.5));
}

TEST_F(AService, RefusesMessagesWhileDisabledAndEnforcesItsLimits) {
    QVReportingStats::shared().TEST_reset();
    QVReportingLimits limits;
    limits.maxClients = 1;
    limits.maxSessionsPerClient = 2;
    makeService(limits);
    auto a = connect(100);
    EXPECT_EQ(connect(200), nullptr);
    Answer again, three;
    a->createReportingSession(1, into(ignored));
    a->createReportingSession(2, into(ignored));
    a->createReportingSession(2, into(again));  // a replacement is not a new session
    a->createReportingSession(3, into(three));
    drain();
    EXPECT_TRUE(again.result);
    ASSERT_TRUE(three.error);
    EXPECT_EQ(three.error->name, "org.freedesktop.DBus.Error.LimitsExceeded");
    EXPECT_EQ(QVReportingStats::shared().limitExceededCount(QVReportingStats::Limit::Clients), 1u);

    a->startReportingSessionForID(1, into(ignored));
    service->setReportingEnabled(false);
    send(*a, {{"k", 1}});
    ASSERT_TRUE(lastSendError);
    EXPECT_EQ(lastSendError->name, "com.korvane.audio.reporting.ReportingDisabled");
    EXPECT_EQ(service->findReportingSessionForID(1), nullptr);
}

TEST_F(AService, KeepsItsSessionListsShortAndCountsCreatedSessions) {
    QVReportingStats::shared().TEST_reset();
    makeService();
    auto a = connect(100);
    test::ScopedMemoryLog log(LogLevel::Default);
    for (ReporterID id = 1; id <= 40; ++id) {
        a->createReportingSession(id, into(ignored));
    }
    drain();
    // Created, not started: counted all the same.
    EXPECT_EQ(QVReportingStats::shared().dump().find("sessions")->asInt64(), 40);
    for (ReporterID id = 1; id <= 20; ++id) {
        a->startReportingSessionForID(id, into(ignored));
    }
    a->stopReportingSessionForID(3, into(ignored));
    a->destroyReportingSession(4, into(ignored));
    drain();
    // 18 run (1..20 but 3 and 4): the line counts them all and names the first 16, in order.
    const auto lines = log->lines();
    const auto last = std::find_if(lines.rbegin(), lines.rend(), [](const auto& l) {
        return l.text.find("active reporting session(s)") != std::string::npos;
    });
    ASSERT_NE(last, lines.rend());
    EXPECT_NE(last->text.find("18 active reporting session(s) (reporterID=1,"), std::string::npos)
        << last->text;
    EXPECT_NE(last->text.find("reporterID=18,"), std::string::npos);
    EXPECT_EQ(last->text.find("reporterID=19,"), std::string::npos);
    EXPECT_NE(last->text.find(", and 2 more)"), std::string::npos);
    EXPECT_EQ(a->activeSessionCount(), 18u);
    EXPECT_EQ(QVReportingStats::shared().dump().find("sessions")->asInt64(), 39);
    // A message to every running session reaches exactly those.
    send(*a, {{"everyone", 1}});
    EXPECT_TRUE(holds(*a->findReportingSessionForID(20, false), "everyone"));
    EXPECT_FALSE(holds(*a->findReportingSessionForID(21, false), "everyone"));
    EXPECT_FALSE(holds(*a->findReportingSessionForID(3, false), "everyone"));
}

}  // namespace
}  // namespace qv
