#include "workers/diagnostics/QVReportingSessionICXWorker.h"

#include "platform/IssueCaptureService.h"
#include "workers/WorkerTestSupport.h"
#include "workers/diagnostics/QVReportingICXWorkerInstanceAlarmLowRMS.h"
#include "workers/diagnostics/QVReportingICXWorkerInstanceHapticLeaks.h"
#include "workers/diagnostics/QVReportingICXWorkerInstanceSSSLeaks.h"

namespace qv {
namespace {

using test::send;

// A detector of the test's own, to drive the counting rule with any thresholds: interested in
// messages that hold "probe", it records each fire.
struct ProbeSettings {
    std::uint64_t count = 1;
    double duration = 0;
    bool once = false;
};

class Probe final : public QVReportingICXWorkerInstance {
  public:
    static constexpr std::string_view kClassName = "Probe";
    static inline ProbeSettings next;
    static inline int fires = 0;

    static std::shared_ptr<Probe> initWithSession(const std::shared_ptr<QVReportingSession>& s) {
        auto p = std::make_shared<Probe>(s);
        p->state_.interestThresholdCount = next.count;
        p->state_.interestThresholdDurationSeconds = next.duration;
        p->state_.oncePerSession = next.once;
        return p;
    }
    explicit Probe(const std::shared_ptr<QVReportingSession>& s)
        : QVReportingICXWorkerInstance(s) {}

    std::string_view className() const override { return kClassName; }
    bool interestedInMessage(const QVReportingSessionMessage& m) override {
        return m.message().contains("probe");
    }
    WorkerInstanceState& workerState() override { return state_; }
    bool implementsFire() const override { return true; }
    void fire(const std::shared_ptr<QVReportingSessionMessage>&) override { ++fires; }

  private:
    WorkerInstanceState state_;
};

class AnICXWorker : public ::testing::Test {
  protected:
    void SetUp() override {
        QVReportingICXSharedStates::TEST_reset();
        QVReportingICXWorkerInstanceSSSLeaks::TEST_resetLastRequest();
        fake.device.internalBuild = true;
        fake.device.haptics = true;
        Probe::fires = 0;
    }
    void TearDown() override { QVReportingICXSharedStates::TEST_reset(); }

    std::shared_ptr<QVReportingSession> make(AudioServiceType serviceType, ReporterID id = 7,
                                             std::vector<std::int64_t> pids = {1234},
                                             bool single = false) {
        return test::makeSession(fake.platform, {.id = id,
                                                 .pids = std::move(pids),
                                                 .serviceType = serviceType,
                                                 .processName = "alarmd",
                                                 .single = single,
                                                 .start = true});
    }
    static std::shared_ptr<QVReportingSessionICXWorker> icx(const QVReportingSession& session) {
        return test::workerOf<QVReportingSessionICXWorker>(session);
    }
    static std::vector<std::string> names(const QVReportingSessionICXWorker& worker) {
        std::vector<std::string> out;
        for (const auto& i : worker.instances()) {
            out.emplace_back(i->className());
        }
        return out;
    }
    std::size_t requests() {
        auto lock = fake.issueCapture.lock();
        return fake.issueCapture.requests.size();
    }

    test::ScopedWorkerClasses<QVReportingSessionICXWorker> workerClasses;
    test::FakePlatform fake;
};

TEST_F(AnICXWorker, ExistsOnInternalBuildsOnlyWithItsDetectorsInOrder) {
    fake.device.internalBuild = false;
    EXPECT_EQ(icx(*make(service::kAlarms)), nullptr);

    test::setInternalBuild(fake.device, true);
    auto withHaptics = icx(*make(service::kAlarms));
    ASSERT_NE(withHaptics, nullptr);
    EXPECT_EQ(names(*withHaptics),
              (std::vector<std::string>{"QVReportingICXWorkerInstanceHapticLeaks",
                                        "QVReportingICXWorkerInstanceAlarmLowRMS",
                                        "QVReportingICXWorkerInstanceTemberDestroyRecordQueue",
                                        "QVReportingICXWorkerInstanceSSSLeaks"}));
    EXPECT_TRUE(withHaptics->started());
    EXPECT_TRUE(withHaptics->handleRedundantMessages());

    fake.device.haptics = false;
    EXPECT_EQ(names(*icx(*make(service::kAlarms))),
              (std::vector<std::string>{"QVReportingICXWorkerInstanceAlarmLowRMS",
                                        "QVReportingICXWorkerInstanceTemberDestroyRecordQueue",
                                        "QVReportingICXWorkerInstanceSSSLeaks"}));

    fake.device.haptics = true;
    auto single = icx(*make(service::kStandalone, 1, {1}, /*single=*/true));
    ASSERT_NE(single, nullptr);
    EXPECT_EQ(names(*single), (std::vector<std::string>{"QVReportingICXWorkerInstanceHapticLeaks",
                                                        "QVReportingICXWorkerInstanceSSSLeaks"}));
}

TEST_F(AnICXWorker, CountsAndFiresByTheRuleOverMessageSequences) {
    struct Step {
        int value;       // payload {"probe": value}; equal values are exact repeats
        double advance;  // seconds the clock moves before the message
        int firesAfter;  // fires counted so far
    };
    struct Case {
        const char* name;
        ProbeSettings settings;
        AudioServiceType serviceType;
        std::vector<Step> steps;
    };
    const std::vector<Case> cases = {
        {"count 2 fires on the second counted message, the duration unread",
         {2, 60.0, false},
         service::kAlarms,
         {{1, 0, 0}, {2, 0.5, 1}, {3, 0, 1}, {4, 0, 2}}},
        {"an exact repeat of the last counted payload does not count; after another it does",
         {2, 60.0, false},
         service::kAlarms,
         {{1, 0, 0}, {1, 0, 0}, {2, 0, 1}, {2, 0, 1}, {2, 0, 1}, {3, 0, 2}}},
        {"count 0: fires once strictly more than the duration has passed",
         {0, 10.0, false},
         service::kAlarms,
         {{1, 0, 0}, {2, 5, 0}, {3, 5, 0}, {4, 0.001, 1}, {5, 0, 0 + 1}, {6, 10.5, 2}}},
        {"once per session: later completions do not fire",
         {2, 0, true},
         service::kAlarms,
         {{1, 0, 0}, {2, 0, 1}, {3, 0, 1}, {4, 0, 1}, {5, 0, 1}}},
        {"a test session consumes the fire without firing",
         {1, 0, false},
         service::kTest,
         {{1, 0, 0}, {2, 0, 0}}},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        Probe::fires = 0;
        Probe::next = c.settings;
        auto session = make(c.serviceType);
        auto worker = icx(*session);
        worker->addInstance<Probe>();
        WorkerInstanceState& state = worker->instances().back()->workerState();
        std::uint64_t lastFired = 0;
        for (std::size_t i = 0; i < c.steps.size(); ++i) {
            SCOPED_TRACE(i);
            fake.clock.advance(c.steps[i].advance);
            // An explicit timestamp keeps equal payloads exactly equal however the clock moves.
            send(*session, {{"probe", c.steps[i].value}, {"qvreporting_timestamp", 1.7e9}},
                 category::kGeneric, type::kGeneric);
            if (c.serviceType == service::kTest) {
                EXPECT_EQ(Probe::fires, 0);
                EXPECT_EQ(state.firedCount, i + 1);
                EXPECT_EQ(state.interestedCount, 0u);
                EXPECT_FALSE(state.lastMessage);
                continue;
            }
            EXPECT_EQ(Probe::fires, c.steps[i].firesAfter);
            if (state.firedCount > lastFired) {
                EXPECT_EQ(state.interestedCount, 0u) << "a fire resets the round";
                EXPECT_FALSE(state.interestFirstSeen);
            }
            lastFired = state.firedCount;
        }
        session->stop();
    }
}

TEST_F(AnICXWorker, HapticLeaksShareOneStateAcrossSessionsAndAskForASnapshot) {
    test::ScopedMemoryLog log(LogLevel::Info);
    auto a = make(service::kHaptics, 10, {111});
    auto b = make(service::kHaptics, 20, {222, 223});
    const auto haptic = [](double seconds) {
        return Dictionary{{"Haptic_Active_Hardware_Time_Seconds", seconds},
                          {"qvreporting_timestamp", 1.7e9}};
    };
    send(*a, haptic(1.0), category::kPlayback, type::kEnergyLog);
    send(*a, haptic(1.0), category::kPlayback, type::kEnergyLog);  // exact repeat: not counted
    send(*a, {{"Other_Key", 1}}, category::kPlayback, type::kEnergyLog);
    EXPECT_EQ(requests(), 0u);
    // The wrong kind of value still names the key: it counts.
    send(*b, {{"Haptic_Active_Hardware_Time_Seconds", "NaN"}}, category::kPlayback,
         type::kEnergyLog);
    ASSERT_EQ(requests(), 1u);
    {
        // The payload names the processes of the session that fired. (The request's kind and
        // signature: the issue-capture end-to-end tests.)
        auto lock = fake.issueCapture.lock();
        const auto& r = fake.issueCapture.requests[0];
        ASSERT_TRUE(r.payload);
        const Dictionary pids{{"processIDs", Array{222, 223}}};
        EXPECT_EQ(
            *r.payload,
            (Dictionary{{std::string(kIssueCaptureKeyPayloadDEParameters),
                         Dictionary{{"com.korvane.EnergylogCore.DESysLogFilterProcess", pids}}}}));
    }
    send(*b, haptic(2.0), category::kPlayback, type::kEnergyLog);
    EXPECT_EQ(requests(), 1u) << "the third counted message starts a new round";
    send(*a, haptic(3.0), category::kPlayback, type::kEnergyLog);
    EXPECT_EQ(requests(), 2u) << "the fourth, in any session, fires again";
    // (The reply's identifier in its log line: the issue-capture end-to-end test.)

    fake.issueCapture.acceptParameters = false;
    send(*b, haptic(4.0), category::kPlayback, type::kEnergyLog);
    send(*b, haptic(5.0), category::kPlayback, type::kEnergyLog);
    EXPECT_TRUE(log->contains("Parameters to ICX session not accepted!"));
}

TEST_F(AnICXWorker, SystemSoundLeaksAreSpacedFifteenSecondsAcrossTheProcess) {
    test::ScopedMemoryLog log(LogLevel::Info);
    auto a = make(service::kSystemSounds, 10, {111});
    auto b = make(service::kSystemSounds, 20, {222});
    const auto stuck = [](int n) {
        return Dictionary{{"System_Sound_Stuck_Time_Seconds", n}, {"qvreporting_timestamp", 1.7e9}};
    };
    send(*a, stuck(1), category::kPlayback, type::kEnergyLog);
    ASSERT_EQ(requests(), 1u);
    fake.clock.advance(10);
    send(*b, stuck(2), category::kPlayback, type::kEnergyLog);
    EXPECT_EQ(requests(), 1u);
    EXPECT_EQ(log->count("Already fired QVReportingICXWorkerInstanceSSSLeaks recently."), 1u);
    auto& state = icx(*a)->instances().back()->workerState();
    EXPECT_EQ(state.firedCount, 2u) << "a suppressed fire still counts";
    EXPECT_EQ(state.interestedCount, 0u);
    fake.clock.advance(5);  // 15 s after the last request: not "less than"
    send(*b, stuck(3), category::kPlayback, type::kEnergyLog);
    ASSERT_EQ(requests(), 2u);
    fake.clock.advance(14.5);
    send(*a, stuck(4), category::kPlayback, type::kEnergyLog);
    EXPECT_EQ(requests(), 2u);
    EXPECT_EQ(state.firedCount, 4u);
    auto lock = fake.issueCapture.lock();
    EXPECT_EQ(*fake.issueCapture.requests[1].signature.find("type"), Value("systemsounds"));
}

TEST_F(AnICXWorker, AlarmLowLevelStartsOneTimedSessionAndCancelsItAtStop) {
    test::ScopedMemoryLog log(LogLevel::Info);
    const auto low = [](int n) { return Dictionary{{"issue_type", "LowRMS"}, {"n", n}}; };
    // Not of interest: another service type, a prefixed category, a number for "issue_type".
    auto other = make(service::kVocalis, 5);
    for (int n = 0; n < 4; ++n) {
        send(*other, low(n), category::kError, type::kIssueDetector);
        send(*other, low(n), 0x1000000B, type::kIssueDetector);
    }
    auto alarm = make(service::kAlarms, 6);
    for (int n = 0; n < 4; ++n) {
        send(*alarm, {{"issue_type", 7}, {"n", n}}, category::kError, type::kIssueDetector);
        send(*alarm, low(n), 0x1000000B, type::kIssueDetector);
    }
    other->stop();
    EXPECT_EQ(requests(), 0u);

    for (int n = 0; n < 6; ++n) {
        send(*alarm, low(n), category::kError, type::kIssueDetector);
        EXPECT_EQ(requests(), n < 2 ? 0u : 1u) << "the third fires, once per session";
    }
    // (The request, the reply's log line and the cancel of a session stopped after its reply: the
    // alarm's end-to-end test.) Stopped before the reply: nothing to cancel.
    alarm->stop();
    {
        auto lock = fake.issueCapture.lock();
        EXPECT_TRUE(fake.issueCapture.cancels.empty());
    }

    auto later = make(service::kAlarms, 8);
    for (int n = 0; n < 3; ++n) {
        send(*later, low(n), category::kError, type::kIssueDetector);
    }
    // Both held replies are answered now; the first detector's state is gone with its session.
    fake.issueCapture.reply({{std::string(kIssueCaptureReplySuccess), true},
                             {std::string(kIssueCaptureReplySessionID), "alarm-9"}});
    later->stop();
    {
        auto lock = fake.issueCapture.lock();
        EXPECT_EQ(fake.issueCapture.cancels, std::vector<std::string>{"alarm-9"});
    }

    // A request the service does not accept is logged as such.
    fake.issueCapture.acceptParameters = false;
    auto refused = make(service::kAlarms, 9);
    for (int n = 0; n < 3; ++n) {
        send(*refused, low(n), category::kError, type::kIssueDetector);
    }
    EXPECT_EQ(requests(), 3u);
    EXPECT_TRUE(log->contains("ICX session for alarm Low RMS failed to start."));
}

TEST_F(AnICXWorker, ReadsEveryReplyOfTheServiceIntoAnIdentifierAndALogLine) {
    test::ScopedMemoryLog log(LogLevel::Debug);
    const std::string ok(kIssueCaptureReplySuccess), id(kIssueCaptureReplySessionID),
        reason(kIssueCaptureReplyReason);
    struct Row {
        Dictionary reply;
        std::string identifier;
        std::string line;
        LogLevel level;
    };
    const std::vector<Row> rows = {
        {{{ok, true}, {id, "abc"}}, "abc", "Started ICX session. sessionId=abc", LogLevel::Info},
        {{{ok, true}},
         "NONE_RETURNED",
         "Started ICX session, but no sessionId found!",
         LogLevel::Error},
        {{{ok, false}, {id, "ignored"}},
         "NONE_RETURNED",
         "Failed starting icx session. Unknown reason.",
         LogLevel::Error},
        {{},
         "NONE_RETURNED",
         "Failed starting icx session. reason=kIssueCaptureErrorNone",
         LogLevel::Error},
        {{{ok, false}, {reason, 42}},
         "NONE_RETURNED",
         "Failed starting icx session. reason=42",
         LogLevel::Info},
        // A known code is logged by its name.
        {{{ok, false}, {reason, kIssueCaptureErrorDailyLimitExceeded}},
         "NONE_RETURNED",
         "Failed starting icx session. reason=kIssueCaptureErrorDailyLimitExceeded",
         LogLevel::Info},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.line);
        log->clear();
        EXPECT_EQ(QVReportingSessionICXWorker::getSessionIdentifierFromResponse(row.reply),
                  row.identifier);
        bool found = false;
        for (const auto& l : log->lines()) {
            if (l.text.ends_with(row.line)) {
                found = true;
                EXPECT_EQ(l.level, row.level);
            }
        }
        EXPECT_TRUE(found);
    }
}

}  // namespace
}  // namespace qv
