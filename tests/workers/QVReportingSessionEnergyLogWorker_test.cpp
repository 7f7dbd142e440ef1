#include "workers/backends/QVReportingSessionEnergyLogWorker.h"

#include "workers/WorkerTestSupport.h"

namespace qv {
namespace {

class AnEnergyLogWorker : public ::testing::Test {
  protected:
    std::shared_ptr<QVReportingSession> make(const char* appName) {
        return test::makeSession(fake.platform,
                                 {.configuration = {{{"KXHostApplicationDisplayID", appName}}}});
    }

    test::ScopedWorkerClasses<QVReportingSessionEnergyLogWorker> workerClasses;
    test::FakePlatform fake;
};

// What the records hold for messages of a session: the energy-log sink's end-to-end test. Here,
// what a session never hands the worker: a message without a time, from a session that is gone.
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
        worker->handleMessage(test::message({{"EngineOnTime", onTime},
                                             {"EngineState", "EngineOff"},
                                             {"Haptic_Active_Hardware_Time_Seconds", nullptr}},
                                            category::kGeneric, type::kEnergyLog));
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
