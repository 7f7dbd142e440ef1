#include "workers/backends/QVReportingSessionEnergyLogWorker.h"

#include <gtest/gtest.h>

#include <cmath>
#include <string>
#include <vector>

#include "fakes/FakePlatform.h"
#include "fakes/MemoryLogSink.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingWorkerRegistry.h"

namespace qv {
namespace {

constexpr const char* kAppNameLine = "failed to get app name for energylog";
constexpr const char* kTimestampLine = "failed to get QVReporting timestamp for energylog";

std::vector<std::string> keysOf(const Dictionary& d) {
    std::vector<std::string> keys;
    for (const auto& [key, value] : d) {
        keys.push_back(key);
    }
    return keys;
}

class AnEnergyLogWorker : public ::testing::Test {
  protected:
    void SetUp() override {
        QVReportingWorkerRegistry::TEST_reset(
            {&makeWorkerClass<QVReportingSessionEnergyLogWorker>()});
    }
    void TearDown() override { QVReportingWorkerRegistry::TEST_reset({}); }

    std::shared_ptr<QVReportingSession> make(const char* appName = "com.example.haptics") {
        auto session = QVReportingSession::initWithID(fake.platform, 7, {1234});
        if (appName != nullptr) {
            const Dictionary config{{"KXHostApplicationDisplayID", appName}};
            session->updateConfigurationWithContentsOfConfiguration(&config);
        }
        return session;
    }
    static std::shared_ptr<QVReportingSessionMessage> message(
        Dictionary payload, AudioEventType t = type::kEnergyLog,
        AudioEventCategory c = category::kGeneric) {
        return std::make_shared<QVReportingSessionMessage>(std::move(payload), c, t);
    }
    // The lines logged on the EnergyLog category.
    static std::vector<std::string> energyLogLines(test::MemoryLogSink& log) {
        std::vector<std::string> lines;
        for (const auto& line : log.lines()) {
            if (line.category == "qvrp") {
                EXPECT_EQ(line.level, LogLevel::Error);
                lines.push_back(line.text.substr(line.text.find(".cpp:") + 5 + 6));
            }
        }
        return lines;
    }

    test::FakePlatform fake;
};

TEST_F(AnEnergyLogWorker, RebuildsOneMessageIntoUpToThreeRecordsInAFixedOrder) {
    test::ScopedMemoryLog log;
    auto session = make();
    session->setIsSingleMessageSession(true);  // it serves those too
    session->start();
    const Value clients = Array{"com.a", "com.b"};
    session->sendMessage(message({{"Haptic_Active_Hardware_Time_Seconds", 3600.5},
                                  {"Active_Clients", clients},
                                  {"EngineState", "EngineOn"},
                                  {"EngineOnTime", 12.25},
                                  {"qvreporting_timestamp", fake.clock.now() - 2},
                                  {"unrelated", 1}},
                                 type::kEnergyLog, category::kPrefixHAL | category::kOutput));
    const auto events = fake.energyLog.events();
    ASSERT_EQ(events.size(), 3u);
    for (const auto& e : events) {
        EXPECT_EQ(e.registryID, 28u);
        EXPECT_FALSE(e.options.has_value());
    }
    const double stamp = fake.clock.now() - 2;
    EXPECT_EQ(events[0].name, "Vantrel_Haptics_EngineOnDuration");
    EXPECT_EQ(keysOf(events[0].payload),
              (std::vector<std::string>{"EngineOnDuration", "ApplicationName", "TimestampEnd"}));
    EXPECT_EQ(events[0].payload, (Dictionary{{"EngineOnDuration", 12.25},
                                             {"ApplicationName", "com.example.haptics"},
                                             {"TimestampEnd", stamp}}));
    EXPECT_EQ(events[1].name, "Vantrel_Haptics_ClientStatus");
    EXPECT_EQ(keysOf(events[1].payload),
              (std::vector<std::string>{"Status", "ApplicationName", "TimestampEnd"}));
    EXPECT_EQ(events[1].payload, (Dictionary{{"Status", 1},
                                             {"ApplicationName", "com.example.haptics"},
                                             {"TimestampEnd", stamp}}));
    EXPECT_EQ(events[2].name, "LeakedHapticsSessionInfo");
    EXPECT_EQ(keysOf(events[2].payload),
              (std::vector<std::string>{"Haptic_Active_Hardware_Time_Seconds", "Active_Clients"}));
    EXPECT_EQ(events[2].payload, (Dictionary{{"Haptic_Active_Hardware_Time_Seconds", 3600.5},
                                             {"Active_Clients", clients}}));
    EXPECT_TRUE(energyLogLines(*log).empty());

    // None of the three keys, or another type holding all of them: nothing, and no log line.
    fake.energyLog.clear();
    session->sendMessage(message({{"EngineOnTimeX", 1}, {"enginestate", "EngineOn"}}));
    for (AudioEventType t : {type::kGeneric, type::kIssueDetector, AudioEventType{9}}) {
        session->sendMessage(message({{"EngineOnTime", 1},
                                      {"EngineState", "EngineOn"},
                                      {"Haptic_Active_Hardware_Time_Seconds", 2}},
                                     t));
    }
    EXPECT_TRUE(fake.energyLog.events().empty());
    EXPECT_TRUE(energyLogLines(*log).empty());
}

TEST_F(AnEnergyLogWorker, GivesStatusOneOnlyForTheExactStringEngineOn) {
    struct Case {
        Value state;
        int status;
    };
    const std::vector<Case> cases = {
        {"EngineOn", 1},
        {"engineon", 0},
        {"ENGINEON", 0},
        {"EngineOn ", 0},
        {"EngineOff", 0},
        {"", 0},
        {1, 0},
        {true, 0},
        {std::nan(""), 0},
        {Array{"EngineOn"}, 0},
        {Dictionary{{"EngineOn", 1}}, 0},
    };
    auto worker = QVReportingSessionEnergyLogWorker::initWithSession(make());
    for (const auto& c : cases) {
        fake.energyLog.clear();
        worker->handleMessage(message({{"EngineState", c.state}}));
        const auto events = fake.energyLog.events();
        ASSERT_EQ(events.size(), 1u) << c.state.description();
        const Value* status = events[0].payload.find("Status");
        ASSERT_TRUE(status);
        EXPECT_EQ(status->kind(), Value::Kind::Int);
        EXPECT_EQ(*status, Value(c.status)) << c.state.description();
    }
}

TEST_F(AnEnergyLogWorker, TreatsAMissingOrUnknownAppNameAndTimestampDifferentlyPerRecord) {
    struct Case {
        const char* what;
        const char* configuredName;  // null: none configured
        bool sessionGone;
        // ApplicationName of the ClientStatus record, or null for none.
        const char* clientStatusName;
    };
    const std::vector<Case> cases = {
        {"no name configured", nullptr, false, "Unknown"},
        {"the name Unknown", "Unknown", false, "Unknown"},
        {"session gone", "com.example.haptics", true, nullptr},
    };
    for (const auto& c : cases) {
        test::ScopedMemoryLog log;
        fake.energyLog.clear();
        auto session = make(c.configuredName);
        auto worker = QVReportingSessionEnergyLogWorker::initWithSession(session);
        if (c.sessionGone) {
            session.reset();
            ASSERT_FALSE(worker->session()) << c.what;
        }
        // No timestamp: only the engine-on-duration handler says so. Values go out as they are.
        const Value onTime = Dictionary{{"odd", "but copied"}};
        worker->handleMessage(message({{"EngineOnTime", onTime}, {"EngineState", "EngineOff"}}));
        const auto events = fake.energyLog.events();
        ASSERT_EQ(events.size(), 2u) << c.what;
        EXPECT_EQ(events[0].payload, (Dictionary{{"EngineOnDuration", onTime}})) << c.what;
        Dictionary status{{"Status", 0}};
        if (c.clientStatusName != nullptr) {
            status.set("ApplicationName", c.clientStatusName);
        }
        EXPECT_EQ(events[1].payload, status) << c.what;
        EXPECT_EQ(energyLogLines(*log), (std::vector<std::string>{kAppNameLine, kTimestampLine}))
            << c.what;
    }

    // A null value is no value: that handler does not apply.
    fake.energyLog.clear();
    auto worker = QVReportingSessionEnergyLogWorker::initWithSession(make());
    worker->handleMessage(message({{"EngineOnTime", nullptr},
                                   {"Haptic_Active_Hardware_Time_Seconds", 1},
                                   {"Active_Clients", nullptr}}));
    const auto events = fake.energyLog.events();
    ASSERT_EQ(events.size(), 1u);
    EXPECT_EQ(events[0].payload, (Dictionary{{"Haptic_Active_Hardware_Time_Seconds", 1}}));
    worker->handleMessage(nullptr);
    EXPECT_EQ(fake.energyLog.events().size(), 1u);
}

}  // namespace
}  // namespace qv
