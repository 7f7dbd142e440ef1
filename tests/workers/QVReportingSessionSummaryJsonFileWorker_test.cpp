#include "workers/derived/QVReportingSessionSummaryJsonFileWorker.h"

#include <nlohmann/json.hpp>

#include <signal.h>
#include <sys/resource.h>

#include <fstream>
#include <iterator>

#include "fakes/TempDirectory.h"
#include "values/ValueJson.h"
#include "workers/WorkerTestSupport.h"

namespace qv {
namespace {

using test::send;

namespace fs = std::filesystem;

class ASummaryJsonFileWorker : public ::testing::Test {
  protected:
    void SetUp() override { fake.device.logsDirectory = logs.path(); }

    std::shared_ptr<QVReportingSession> make(AudioServiceType serviceType,
                                             const std::string& appName = "com.example.rec") {
        return test::makeSession(fake.platform,
                                 {.id = 42,
                                  .serviceType = serviceType,
                                  .configuration = {{{"KXHostApplicationDisplayID", appName}}}});
    }
    std::vector<fs::path> files() const { return test::filesIn(logs / "Audio/Reporting"); }

    test::ScopedWorkerClasses<QVReportingSessionSummaryJsonFileWorker> workerClasses;
    test::TempDirectory logs{"qvsummaryfile"};
    test::FakePlatform fake;
};

TEST_F(ASummaryJsonFileWorker, WritesEachStoredMessageOnceUnderItsCountedKindAsAJsonArray) {
    auto session = make(service::kTest);
    session->start();
    for (int n : {1, 2, 2}) {  // the repeat is redundant: not written
        send(*session, {{"n", n}}, category::kPlayback, type::kStart);
    }
    send(*session, {{"v", 0.5}, {"text", "a \"quoted\"\nline"}}, category::kVolume, type::kSummary);
    EXPECT_TRUE(files().empty()) << "nothing is written before the stop";
    session->stop();

    const auto written = files();
    ASSERT_EQ(written.size(), 1u);
    // "yyyyMMdd-HHmmss" and the zone ("+hhmm" or "-hhmm"), then the session's own parts.
    const std::string name = written[0].filename().string();
    EXPECT_EQ(test::timeStampShape(name), "99999999+999999+9999") << name;
    EXPECT_EQ(name.substr(20), "-42-com.example.rec-test.json");

    std::ifstream in(written[0]);
    const std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    EXPECT_EQ(text.rfind("[\n{\n", 0), 0u);
    EXPECT_NE(text.find("}\n,\n{\n"), std::string::npos);
    EXPECT_EQ(text.substr(text.size() - 4), "}\n]\n");
    const auto array = nlohmann::ordered_json::parse(text);
    std::vector<std::string> members;
    for (const auto& element : array) {
        ASSERT_EQ(element.size(), 1u);
        members.push_back(element.begin().key());
    }
    EXPECT_EQ(members,
              (std::vector<std::string>{"Setup_Start_1", "Playback_Start_1", "Playback_Start_2",
                                        "Volume_Summary_1", "Setup_Stop_1"}));
    const Dictionary volume = QVReportingDictionaryFromJson(array[3]["Volume_Summary_1"]);
    EXPECT_EQ(*volume.find("text"), Value("a \"quoted\"\nline"));
    EXPECT_EQ(*volume.find("isSessionStarted"), Value("YES"));
}

TEST_F(ASummaryJsonFileWorker, ExistsOnlyForTestSessionsOrInternalBuildsAndOnlyWithMessages) {
    fake.device.internalBuild = false;
    EXPECT_FALSE(QVReportingSessionSummaryJsonFileWorker::initWithSession(make(service::kGeneric)));
    EXPECT_TRUE(QVReportingSessionSummaryJsonFileWorker::initWithSession(make(service::kTest)));
    test::setInternalBuild(fake.device, true);
    EXPECT_TRUE(QVReportingSessionSummaryJsonFileWorker::initWithSession(make(service::kGeneric)));

    // Every stored message redundant: no file is opened.
    auto session = make(service::kTest);
    auto worker = QVReportingSessionSummaryJsonFileWorker::initWithSession(session);
    session->start();
    send(*session, {{"n", 1}}, category::kPlayback, type::kStart);
    for (const auto& message : session->messages()) {
        message->setIsRedundant(true);
    }
    worker->stop();
    EXPECT_TRUE(files().empty());
}

TEST_F(ASummaryJsonFileWorker, LogsFileErrorsAndLetsTheSessionGoOn) {
    test::ScopedMemoryLog log;
    std::ofstream(logs / "blocked") << "x";  // a plain file where the directory should be
    fake.device.logsDirectory = logs / "blocked";
    auto session = make(service::kTest);
    for (int run = 1; run <= 2; ++run) {
        session->start();
        send(*session, {{"n", run}}, category::kPlayback, type::kStart);
        session->stop();
        EXPECT_EQ(log->count("SummaryJsonFileWorker failed to open file. action=open file="),
                  static_cast<std::size_t>(run));
    }
    EXPECT_EQ(log->count("can't create logging directory at "), 2u);
}

TEST_F(ASummaryJsonFileWorker, LeavesNoFileNorHalfOfOneWhenTheDiskIsFull) {
    // A file size limit plays the full disk: a write past it fails (SIGXFSZ ignored: EFBIG).
    test::ScopedMemoryLog log;
    fake.device.logsDirectory = logs.path();
    const auto previous = ::signal(SIGXFSZ, SIG_IGN);
    rlimit saved{};
    ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &saved), 0);
    auto session = make(service::kTest);
    session->start();
    send(*session, {{"pad", std::string(4096, 'p')}}, category::kPlayback, type::kStart);
    rlimit small = saved;
    small.rlim_cur = 1024;
    ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &small), 0);
    session->stop();
    ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &saved), 0);
    ::signal(SIGXFSZ, previous);
    EXPECT_TRUE(files().empty()) << "neither the file nor its temporary one";
    EXPECT_TRUE(log->contains("SummaryJsonFileWorker failed to write line."));
    EXPECT_TRUE(log->contains("(no file left)"));

    // Room again: the next stop writes a whole file.
    session->start();
    send(*session, {{"n", 2}}, category::kPlayback, type::kStart);
    session->stop();
    ASSERT_EQ(files().size(), 1u);
    std::ifstream in(files()[0]);
    EXPECT_FALSE(nlohmann::ordered_json::parse(in, nullptr, false).is_discarded());
}

}  // namespace
}  // namespace qv
