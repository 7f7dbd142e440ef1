#include "workers/derived/QVReportingSessionSummaryWorker.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

#include "fakes/FakePlatform.h"
#include "fakes/MemoryLogSink.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingWorkerRegistry.h"
#include "workers/backends/QVReportingSessionMetricsHubWorker.h"

namespace qv {
namespace {

constexpr const char* kSummaryEvent = "com.korvane.qvsound.Session_Generic.Summary";

// Sessions with the summary worker and MetricsHub, which hands the summary to the fake analytics.
class ASummaryWorker : public ::testing::Test {
  protected:
    void SetUp() override {
        QVReportingWorkerRegistry::TEST_reset(
            {&makeWorkerClass<QVReportingSessionSummaryWorker>(),
             &makeWorkerClass<QVReportingSessionMetricsHubWorker>()});
        session = QVReportingSession::initWithID(fake.platform, 21, {1234});
        session->setServiceType(service::kLongFormAudio);
        session->start();
    }
    void TearDown() override { QVReportingWorkerRegistry::TEST_reset({}); }

    void send(Dictionary payload, AudioEventCategory c = category::kGeneric,
              AudioEventType t = type::kGeneric) {
        session->sendMessage(std::make_shared<QVReportingSessionMessage>(std::move(payload), c, t));
    }
    // The one summary the stop produced.
    Dictionary stopAndGetSummary() {
        session->stop();
        const auto events = fake.analytics.eventsNamed(kSummaryEvent);
        EXPECT_EQ(events.size(), 1u);
        return events.empty() ? Dictionary{} : events.front().payload;
    }

    test::FakePlatform fake;
    std::shared_ptr<QVReportingSession> session;
};

TEST_F(ASummaryWorker, CountsActiveTimeOverloadsAndRedundantMessages) {
    send({{"session_duration", 1}}, category::kPlayback, type::kStop);
    // Active time alone counts for a message that also reports an overload.
    send({{"session_duration", 2.5}, {"issue_type", "overload"}}, category::kPlayback, type::kStop);
    // A duration that is not a number adds nothing but still counts as activity.
    send({{"session_duration", "long"}}, category::kPlayback, type::kStop);
    send({{"issue_type", "overload"}});
    send({{"issue_type", "overload"}});  // redundant: never offered to the worker
    send({{"issue_type", "Overload"}});  // not an overload: the match is exact
    for (int i = 0; i < 10; ++i) {
        send({{"k", 1}});  // the first is stored, nine are redundant
    }
    const Dictionary summary = stopAndGetSummary();
    EXPECT_EQ(*summary.find("total_active_time"), Value(3.5));
    EXPECT_EQ(*summary.find("active_count"), Value(3u));
    EXPECT_EQ(*summary.find("overload_count"), Value(1u));
    EXPECT_DOUBLE_EQ(summary.find("average_active_time")->doubleValue(), 3.5 / 3);
    // 16 received; stored: 6 of them plus the session's start and stop state messages.
    EXPECT_EQ(*summary.find("num_messages"), Value(16));
    EXPECT_EQ(*summary.find("num_unique_messages"), Value(8u));
    EXPECT_EQ(*summary.find("num_redundant_messages"), Value(8u));
    EXPECT_EQ(summary.find("num_redundant_messages")->kind(), Value::Kind::UInt);
    EXPECT_EQ(summary.find("num_messages")->kind(), Value::Kind::Int);
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
    const std::vector<std::string> keys = {"total_active_time",      "active_count",
                                           "overload_count",         "average_active_time",
                                           "num_messages",           "num_unique_messages",
                                           "num_redundant_messages", "singleMessageSession",
                                           "summaryServiceName",     "HostApplicationDisplayID",
                                           "clientProcessName",      "thermal_state",
                                           "low_power_enabled",      "vmInfo_phys_footprint_MiB",
                                           "load_avg_1_min",         "load_avg_5_min",
                                           "load_avg_15_min"};
    std::vector<std::string> got;
    for (const auto& [key, value] : summary) {
        got.push_back(key);
    }
    got.resize(std::min(got.size(), keys.size()));
    EXPECT_EQ(got, keys);
    // No activity: zeros, and an average of zero rather than a division by zero. The two state
    // messages are stored without being received: the redundant count stops at zero.
    EXPECT_EQ(*summary.find("average_active_time"), Value(0.0));
    EXPECT_EQ(*summary.find("num_messages"), Value(0));
    EXPECT_EQ(*summary.find("num_redundant_messages"), Value(0u));
    EXPECT_EQ(*summary.find("singleMessageSession"), Value(false));
    EXPECT_EQ(*summary.find("summaryServiceName"), Value("longformaudio"));
    EXPECT_EQ(*summary.find("HostApplicationDisplayID"), Value("com.example.music"));
    EXPECT_EQ(*summary.find("clientProcessName"), Value("player"));
    EXPECT_EQ(*summary.find("thermal_state"), Value("Serious"));
    EXPECT_EQ(*summary.find("low_power_enabled"), Value(true));
    EXPECT_EQ(*summary.find("vmInfo_phys_footprint_MiB"), Value(5u));
    EXPECT_EQ(*summary.find("load_avg_5_min"), Value(1.25));
}

TEST_F(ASummaryWorker, LeavesOutWhatCannotBeKnown) {
    test::ScopedMemoryLog log;
    fake.condition.thermal = ThermalState::Unknown;
    fake.condition.footprintError = "no such file";
    const Dictionary summary = stopAndGetSummary();
    EXPECT_FALSE(summary.contains("clientProcessName"));
    EXPECT_FALSE(summary.contains("vmInfo_phys_footprint_MiB"));
    EXPECT_EQ(*summary.find("HostApplicationDisplayID"), Value("Unknown"));
    EXPECT_EQ(*summary.find("thermal_state"), Value("Unknown"));
    EXPECT_TRUE(summary.contains("load_avg_1_min"));
    const auto lines = log->lines();
    const auto error = std::find_if(lines.begin(), lines.end(), [](const auto& line) {
        return line.text.find("Error with task_info(): no such file") != std::string::npos;
    });
    ASSERT_NE(error, lines.end());
    EXPECT_EQ(error->category, "qvru");
    EXPECT_EQ(error->level, LogLevel::Error);
}

}  // namespace
}  // namespace qv
