#include "workers/derived/QVReportingSessionSummaryWorker.h"

#include <algorithm>
#include <limits>

#include "session/QVReportingStats.h"
#include "workers/WorkerTestSupport.h"
#include "workers/backends/QVReportingSessionMetricsHubWorker.h"

namespace qv {
namespace {

constexpr const char* kSummaryEvent = "com.korvane.qvsound.Session_Generic.Summary";

// MetricsHub hands the summary to the fake analytics.
class ASummaryWorker : public ::testing::Test {
  protected:
    void SetUp() override {
        session = test::makeSession(
            fake.platform, {.id = 21, .serviceType = service::kLongFormAudio, .start = true});
    }

    void send(Dictionary payload, AudioEventCategory c = category::kGeneric,
              AudioEventType t = type::kGeneric) {
        session->sendMessage(test::message(std::move(payload), c, t));
    }
    // The one summary the stop produced.
    Dictionary stopAndGetSummary() {
        session->stop();
        const auto events = fake.analytics.eventsNamed(kSummaryEvent);
        EXPECT_EQ(events.size(), 1u);
        return events.empty() ? Dictionary{} : events.front().payload;
    }

    test::ScopedWorkerClasses<QVReportingSessionSummaryWorker, QVReportingSessionMetricsHubWorker>
        workerClasses;
    test::FakePlatform fake;
    std::shared_ptr<QVReportingSession> session;
};

TEST_F(ASummaryWorker, CountsActivityAndMessagesAndLeavesOutWhatCannotBeKnown) {
    test::ScopedMemoryLog log;
    fake.condition.thermal = ThermalState::Unknown;
    fake.condition.footprintError = "no such file";
    send({{"session_duration", 1}}, category::kPlayback, type::kStop);
    // An overload with a duration counts as activity only; a duration as text adds the number
    // it starts with, or nothing.
    send({{"session_duration", 2.5}, {"issue_type", "overload"}}, category::kPlayback, type::kStop);
    send({{"session_duration", "long"}}, category::kPlayback, type::kStop);
    send({{"session_duration", "0.25 s"}}, category::kPlayback, type::kStop);
    send({{"issue_type", "overload"}});
    send({{"issue_type", "overload"}});  // redundant: never offered to the worker
    send({{"issue_type", "Overload"}});  // the match is exact
    for (int i = 0; i < 10; ++i) {
        send({{"k", 1}});  // the first is stored, nine are redundant
    }
    const Dictionary summary = stopAndGetSummary();
    EXPECT_EQ(*summary.find("total_active_time"), Value(3.75));
    EXPECT_EQ(*summary.find("active_count"), Value(4u));
    EXPECT_EQ(*summary.find("overload_count"), Value(1u));
    EXPECT_DOUBLE_EQ(summary.find("average_active_time")->doubleValue(), 3.75 / 4);
    // 17 received; stored: 7 of them plus the session's start and stop state messages.
    EXPECT_EQ(*summary.find("num_messages"), Value(17));
    EXPECT_EQ(*summary.find("num_unique_messages"), Value(9u));
    EXPECT_EQ(*summary.find("num_redundant_messages"), Value(8u));

    EXPECT_FALSE(summary.contains("clientProcessName"));
    EXPECT_FALSE(summary.contains("vmInfo_phys_footprint_MiB"));
    EXPECT_EQ(*summary.find("HostApplicationDisplayID"), Value("Unknown"));
    EXPECT_EQ(*summary.find("thermal_state"), Value("Unknown"));
    EXPECT_EQ(log->count("Error with task_info(): no such file"), 1u);
}

TEST_F(ASummaryWorker, ForwardsWhatTheStoreBudgetsLeaveUnstoredAndSaysHowMany) {
    test::ScopedMemoryLog log;
    auto& stats = QVReportingStats::shared();
    stats.TEST_reset();
    const std::size_t daemonBefore = stats.storeBytes();
    const std::size_t sessionBefore = session->storedBytes();
    const std::size_t budget = sessionBefore + 2000;
    stats.setStoreBudgets(budget, std::numeric_limits<std::size_t>::max());
    for (int i = 0; i < 50; ++i) {
        send({{"i", i}, {"padding", std::string(100, 'x')}});
    }
    const std::size_t stored = session->messages().size() - 1;  // the start state message aside
    EXPECT_GT(stored, 0u);
    EXPECT_LT(stored, 50u);
    EXPECT_LE(session->storedBytes(), budget);
    EXPECT_EQ(session->messagesNotStored(), 50 - stored);
    EXPECT_EQ(stats.messagesNotStored(), 50 - stored);
    EXPECT_EQ(stats.storeBytes() - daemonBefore, session->storedBytes() - sessionBefore);
    EXPECT_EQ(fake.analytics.eventsNamed("com.korvane.qvsound.Generic.Generic").size(), 50u)
        << "every message is forwarded, stored or not";
    EXPECT_EQ(log->count("store budget used up: session 21"), 1u) << "one warning a run";

    // The daemon-wide budget holds for every session.
    auto other = test::makeSession(fake.platform, {.id = 22, .pids = {1}, .start = true});
    stats.setStoreBudgets(std::numeric_limits<std::size_t>::max(), stats.storeBytes());
    other->sendMessage(std::make_shared<QVReportingSessionMessage>(
        Dictionary{{"x", 1}}, category::kGeneric, type::kGeneric));
    EXPECT_EQ(other->messages().size(), 1u);
    EXPECT_EQ(other->messagesNotStored(), 1u);
    other.reset();

    stats.setStoreBudgets(budget, std::numeric_limits<std::size_t>::max());
    const Dictionary summary = stopAndGetSummary();
    EXPECT_EQ(*summary.find("num_messages"), Value(50));
    EXPECT_EQ(*summary.find("num_messages_not_stored"), Value(std::uint64_t{50 - stored}));
    EXPECT_EQ(*summary.find("num_redundant_messages"), Value(0u)) << "unstored is not redundant";
    EXPECT_EQ(stats.storeBytes(), daemonBefore - sessionBefore) << "a stop gives the bytes back";

    // The next run starts with an empty store and a summary without the key.
    session->start();
    send({{"again", 1}});
    EXPECT_EQ(session->messages().size(), 2u);
    EXPECT_EQ(session->messagesNotStored(), 0u);
    session->stop();
    EXPECT_FALSE(fake.analytics.eventsNamed(kSummaryEvent)
                     .back()
                     .payload.contains("num_messages_not_stored"));
    stats.TEST_reset();
}

TEST_F(ASummaryWorker, DescribesTheSessionAndTheDeviceInItsFixedKeyOrder) {
    session->setClientProcessName("player");
    const Dictionary config{{"KXHostApplicationDisplayID", "com.example.music"}};
    session->updateConfigurationWithContentsOfConfiguration(&config);
    fake.condition.thermal = ThermalState::Serious;
    fake.condition.lowPower = true;
    fake.condition.footprintBytes = (std::uint64_t{5} << 20) + 12345;  // truncated to 5 MiB
    fake.condition.loads = {0.5, 1.25, 2.0};

    const Dictionary summary = stopAndGetSummary();
    // No activity: an average of zero, not a division by zero; the two state messages are stored
    // without being received.
    const std::vector<std::pair<std::string, Value>> expected = {
        {"total_active_time", 0.0},
        {"active_count", 0u},
        {"overload_count", 0u},
        {"average_active_time", 0.0},
        {"num_messages", 0},
        {"num_unique_messages", 2u},
        {"num_redundant_messages", 0u},
        {"singleMessageSession", false},
        {"summaryServiceName", "longformaudio"},
        {"HostApplicationDisplayID", "com.example.music"},
        {"clientProcessName", "player"},
        {"thermal_state", "Serious"},
        {"low_power_enabled", true},
        {"vmInfo_phys_footprint_MiB", 5u},
        {"load_avg_1_min", 0.5},
        {"load_avg_5_min", 1.25},
        {"load_avg_15_min", 2.0}};
    std::vector<std::pair<std::string, Value>> got;
    for (const auto& [key, value] : summary) {
        got.emplace_back(key.str(), value);
    }
    got.resize(std::min(got.size(), expected.size()));
    EXPECT_EQ(got, expected);
    for (std::size_t i = 0; i < got.size(); ++i) {
        EXPECT_EQ(got[i].second.kind(), expected[i].second.kind()) << got[i].first;
    }
}

}  // namespace
}  // namespace qv
