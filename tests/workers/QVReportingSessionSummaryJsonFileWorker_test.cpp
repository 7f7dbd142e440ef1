#include "workers/derived/QVReportingSessionSummaryJsonFileWorker.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <cctype>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "fakes/FakePlatform.h"
#include "fakes/MemoryLogSink.h"
#include "fakes/TempDirectory.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingUtility.h"
#include "session/QVReportingWorkerRegistry.h"
#include "values/ValueJson.h"

namespace qv {
namespace {

namespace fs = std::filesystem;

class ASummaryJsonFileWorker : public ::testing::Test {
  protected:
    void SetUp() override {
        QVReportingUtilityTEST_resetInternalBuild();
        QVReportingWorkerRegistry::TEST_reset(
            {&makeWorkerClass<QVReportingSessionSummaryJsonFileWorker>()});
        fake.device.logsDirectory = logs.path();
    }
    void TearDown() override {
        QVReportingWorkerRegistry::TEST_reset({});
        QVReportingUtilityTEST_resetInternalBuild();
    }

    std::shared_ptr<QVReportingSession> make(AudioServiceType serviceType,
                                             const std::string& appName = "com.example.rec") {
        auto session = QVReportingSession::initWithID(fake.platform, 42, {1234});
        session->setServiceType(serviceType);
        const Dictionary config{{"KXHostApplicationDisplayID", appName}};
        session->updateConfigurationWithContentsOfConfiguration(&config);
        return session;
    }
    static void send(QVReportingSession& session, Dictionary payload, AudioEventCategory c,
                     AudioEventType t) {
        session.sendMessage(std::make_shared<QVReportingSessionMessage>(std::move(payload), c, t));
    }
    std::vector<fs::path> files() const {
        std::vector<fs::path> found;
        const fs::path directory = logs / "Audio/Reporting";
        if (fs::exists(directory)) {
            for (const auto& entry : fs::directory_iterator(directory)) {
                found.push_back(entry.path());
            }
        }
        return found;
    }

    test::TempDirectory logs{"qvsummaryfile"};
    test::FakePlatform fake;
};

TEST_F(ASummaryJsonFileWorker, WritesEachStoredMessageOnceUnderItsCountedKindAsAJsonArray) {
    auto session = make(service::kTest);
    session->start();
    send(*session, {{"n", 1}}, category::kPlayback, type::kStart);
    send(*session, {{"n", 2}}, category::kPlayback, type::kStart);
    send(*session, {{"n", 2}}, category::kPlayback, type::kStart);  // redundant: not written
    send(*session, {{"v", 0.5}, {"text", "a \"quoted\"\nline"}}, category::kVolume, type::kSummary);
    EXPECT_TRUE(files().empty()) << "nothing is written before the stop";
    session->stop();

    const auto written = files();
    ASSERT_EQ(written.size(), 1u);
    const std::string name = written[0].filename().string();
    // "yyyyMMdd-HHmmss" and the zone ("+hhmm" or "-hhmm"), then the session's own parts.
    ASSERT_GT(name.size(), 20u) << name;
    for (const std::size_t digit :
         {0, 1, 2, 3, 4, 5, 6, 7, 9, 10, 11, 12, 13, 14, 16, 17, 18, 19}) {
        EXPECT_TRUE(std::isdigit(static_cast<unsigned char>(name[digit]))) << name;
    }
    EXPECT_EQ(name[8], '-') << name;
    EXPECT_TRUE(name[15] == '+' || name[15] == '-') << name;
    EXPECT_EQ(name.substr(20), "-42-com.example.rec-test.json");

    std::ifstream in(written[0]);
    const std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    // One "[" line, objects separated by "," lines, one "]" line.
    EXPECT_EQ(text.rfind("[\n{\n", 0), 0u);
    EXPECT_NE(text.find("}\n,\n{\n"), std::string::npos);
    EXPECT_EQ(text.substr(text.size() - 4), "}\n]\n");

    const auto array = nlohmann::ordered_json::parse(text);
    std::vector<std::string> members;
    for (const auto& element : array) {
        ASSERT_EQ(element.size(), 1u);
        members.push_back(element.begin().key());
    }
    const std::vector<std::string> expected = {"Setup_Start_1", "Playback_Start_1",
                                               "Playback_Start_2", "Volume_Summary_1",
                                               "Setup_Stop_1"};
    EXPECT_EQ(members, expected);
    // The payload goes out as the session holds it, with the started flag added.
    const Dictionary volume = QVReportingDictionaryFromJson(array[3]["Volume_Summary_1"]);
    EXPECT_EQ(*volume.find("text"), Value("a \"quoted\"\nline"));
    EXPECT_EQ(*volume.find("v"), Value(0.5));
    EXPECT_EQ(*volume.find("isSessionStarted"), Value("YES"));
}

TEST_F(ASummaryJsonFileWorker, ExistsOnlyForTestSessionsOrInternalBuilds) {
    fake.device.internalBuild = false;
    EXPECT_FALSE(QVReportingSessionSummaryJsonFileWorker::initWithSession(make(service::kGeneric)));
    EXPECT_TRUE(QVReportingSessionSummaryJsonFileWorker::initWithSession(make(service::kTest)));
    auto generic = make(service::kGeneric);
    generic->start();
    send(*generic, {{"n", 1}}, category::kPlayback, type::kStart);
    generic->stop();
    EXPECT_TRUE(files().empty());

    QVReportingUtilityTEST_resetInternalBuild();
    fake.device.internalBuild = true;
    EXPECT_TRUE(QVReportingSessionSummaryJsonFileWorker::initWithSession(make(service::kGeneric)));
}

TEST_F(ASummaryJsonFileWorker, OpensNoFileWhenEveryStoredMessageIsRedundant) {
    auto session = make(service::kTest);
    auto worker = QVReportingSessionSummaryJsonFileWorker::initWithSession(session);
    session->start();
    send(*session, {{"n", 1}}, category::kPlayback, type::kStart);
    for (const auto& message : session->messages()) {
        message->setIsRedundant(true);
    }
    worker->stop();
    EXPECT_TRUE(files().empty());
    EXPECT_TRUE(worker->reportPath().empty());
}

TEST_F(ASummaryJsonFileWorker, KeepsEveryFileInsideItsDirectoryWhateverTheApplicationName) {
    const std::vector<std::string> names = {"../../etc/x", "line\nfeed", std::string(10000, 'a'),
                                            "", ".hidden"};
    for (const auto& appName : names) {
        auto session = make(service::kTest, appName);
        session->start();
        send(*session, {{"n", 1}}, category::kPlayback, type::kStart);
        session->stop();
    }
    const auto written = files();
    EXPECT_EQ(written.size(), names.size()) << "one file per session, none elsewhere";
    for (const auto& path : written) {
        EXPECT_LE(path.filename().string().size(), 255u);
    }
    EXPECT_FALSE(fs::exists(logs / "etc"));
}

TEST_F(ASummaryJsonFileWorker, LogsEveryFileErrorAndLetsTheSessionGoOn) {
    test::ScopedMemoryLog log;
    // A plain file where the directory should be: nothing can be created below it.
    std::ofstream(logs / "blocked") << "x";
    fake.device.logsDirectory = logs / "blocked";
    auto session = make(service::kTest);
    session->start();
    send(*session, {{"n", 1}}, category::kPlayback, type::kStart);
    session->stop();

    EXPECT_EQ(log->count("can't create logging directory at "), 1u);
    EXPECT_EQ(log->count("SummaryJsonFileWorker failed to open file. action=open file="), 1u);
    // The later messages go through the handle that never opened, each write failing.
    EXPECT_GE(log->count("SummaryJsonFileWorker failed to write line. action=writeline file="), 2u);
    EXPECT_EQ(log->count("SummaryJsonFileWorker failed to closed file. action=close file="), 1u);
    // The session is still usable: a second run writes nothing more and logs the same way.
    session->start();
    send(*session, {{"n", 2}}, category::kPlayback, type::kStart);
    session->stop();
    EXPECT_EQ(log->count("SummaryJsonFileWorker failed to open file. action=open file="), 2u);
}

}  // namespace
}  // namespace qv
