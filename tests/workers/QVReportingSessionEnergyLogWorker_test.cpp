#include "workers/backends/QVReportingSessionEnergyLogWorker.h"

#include <cmath>

#include "workers/WorkerTestSupport.h"

namespace qv {
namespace {

class AnEnergyLogWorker : public ::testing::Test {
  protected:
    std::shared_ptr<QVReportingSession> make(const char* appName) {
        return test::makeSession(fake.platform,
                                 {.configuration = {{{"KXHostApplicationDisplayID", appName}}}});
    }
    static std::shared_ptr<QVReportingSessionMessage> message(
        Dictionary payload, AudioEventType t = type::kEnergyLog,
        AudioEventCategory c = category::kGeneric) {
        return test::message(std::move(payload), c, t);
    }

    test::ScopedWorkerClasses<QVReportingSessionEnergyLogWorker> workerClasses;
    test::FakePlatform fake;
};

TEST_F(AnEnergyLogWorker, RebuildsOneMessageIntoUpToThreeRecordsInAFixedOrder) {
    test::ScopedMemoryLog log;
    auto session = make("com.example.haptics");
    session->setIsSingleMessageSession(true);  // it serves those too
    session->start();
    // The records' names, order, keys and values: the sink's end-to-end test. Here, what it
    // cannot see: any category serves, the end time is the message's, a status is an integer.
    const double stamp = fake.clock.now() - 2;
    session->sendMessage(message({{"Haptic_Active_Hardware_Time_Seconds", 3600.5},
                                  {"Active_Clients", Array{"com.a"}},
                                  {"EngineState", "EngineOn"},
                                  {"EngineOnTime", 12.25},
                                  {"qvreporting_timestamp", stamp}},
                                 type::kEnergyLog, category::kPrefixHAL | category::kOutput));
    const auto events = fake.energyLog.events();
    ASSERT_EQ(events.size(), 3u);
    for (const auto& e : events) {
        EXPECT_EQ(e.registryID, 28u);
        EXPECT_FALSE(e.options.has_value());
    }
    EXPECT_EQ(*events[0].payload.find("TimestampEnd"), Value(stamp));
    EXPECT_EQ(events[1].payload.find("Status")->kind(), Value::Kind::Int);

    // None of the keys: nothing, and no log line. (Another type: the sink's end-to-end test.)
    fake.energyLog.clear();
    session->sendMessage(message({{"EngineOnTimeX", 1}, {"enginestate", "EngineOn"}}));
    EXPECT_TRUE(fake.energyLog.events().empty());
    EXPECT_TRUE(test::errorTexts(*log, "qvrp").empty());
}

TEST_F(AnEnergyLogWorker, GivesStatusOneOnlyForTheExactStringEngineOn) {
    auto session = make("a");
    auto worker = QVReportingSessionEnergyLogWorker::initWithSession(session);
    for (const auto& [state, status] : std::vector<std::pair<Value, int>>{{"EngineOn", 1},
                                                                          {"engineon", 0},
                                                                          {"EngineOn ", 0},
                                                                          {"EngineOff", 0},
                                                                          {1, 0},
                                                                          {true, 0},
                                                                          {std::nan(""), 0},
                                                                          {Array{"EngineOn"}, 0}}) {
        fake.energyLog.clear();
        worker->handleMessage(message({{"EngineState", state}}));
        const auto events = fake.energyLog.events();
        ASSERT_EQ(events.size(), 1u) << state.description();
        EXPECT_EQ(*events[0].payload.find("Status"), Value(status)) << state.description();
    }
}

TEST_F(AnEnergyLogWorker, TreatsAMissingOrUnknownAppNameAndTimestampDifferentlyPerRecord) {
    struct Case {
        const char* what;
        const char* configuredName;
        bool sessionGone;
        const char* clientStatusName;  // ApplicationName of the ClientStatus record; null: none
    };
    for (const auto& c : std::vector<Case>{{"the name Unknown", "Unknown", false, "Unknown"},
                                           {"session gone", "com.example", true, nullptr}}) {
        test::ScopedMemoryLog log;
        fake.energyLog.clear();
        auto session = make(c.configuredName);
        auto worker = QVReportingSessionEnergyLogWorker::initWithSession(session);
        if (c.sessionGone) {
            session.reset();
        }
        // No timestamp: only the engine-on-duration handler says so. Values go out as they are;
        // a null value is no value.
        const Value onTime = Dictionary{{"odd", "but copied"}};
        worker->handleMessage(message({{"EngineOnTime", onTime},
                                       {"EngineState", "EngineOff"},
                                       {"Haptic_Active_Hardware_Time_Seconds", nullptr}}));
        const auto events = fake.energyLog.events();
        ASSERT_EQ(events.size(), 2u) << c.what;
        EXPECT_EQ(events[0].payload, (Dictionary{{"EngineOnDuration", onTime}})) << c.what;
        Dictionary status{{"Status", 0}};
        if (c.clientStatusName != nullptr) {
            status.set("ApplicationName", c.clientStatusName);
        }
        EXPECT_EQ(events[1].payload, status) << c.what;
        EXPECT_EQ(test::errorTexts(*log, "qvrp"),
                  (std::vector<std::string>{"failed to get app name for energylog",
                                            "failed to get QVReporting timestamp for energylog"}))
            << c.what;
    }
}

}  // namespace
}  // namespace qv
