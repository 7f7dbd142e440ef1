#include "workers/derived/QVReportingSessionSummaryJsonFileWorker.h"

#include <nlohmann/json.hpp>

#include <fstream>

#include "fakes/FileSizeLimit.h"
#include "fakes/TempDirectory.h"
#include "workers/WorkerTestSupport.h"

namespace qv {
namespace {

using test::send;

namespace fs = std::filesystem;

class ASummaryJsonFileWorker : public ::testing::Test {
  protected:
    void SetUp() override { fake.device.logsDirectory = logs.path(); }

    std::shared_ptr<QVReportingSession> make(AudioServiceType serviceType) {
        return test::makeSession(fake.platform, {.id = 42, .serviceType = serviceType});
    }
    std::vector<fs::path> files() const { return test::filesIn(logs / "Audio/Reporting"); }

    test::ScopedWorkerClasses<QVReportingSessionSummaryJsonFileWorker> workerClasses;
    test::TempDirectory logs{"qvsummaryfile"};
    test::FakePlatform fake;
};

// The file a test session's stop writes, its name and what it holds: the end-to-end test of
// derived messages.
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
    test::ScopedMemoryLog log;
    auto session = make(service::kTest);
    session->start();
    send(*session, {{"pad", std::string(4096, 'p')}}, category::kPlayback, type::kStart);
    {
        test::FileSizeLimit full(1024);
        session->stop();
    }
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
