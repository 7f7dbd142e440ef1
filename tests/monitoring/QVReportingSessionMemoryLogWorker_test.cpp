#include "monitoring/QVReportingSessionMemoryLogWorker.h"

#include "session/QVReportingStats.h"
#include "workers/WorkerTestSupport.h"

namespace qv {
namespace {

using Worker = QVReportingSessionMemoryLogWorker;
using Ending = ProcessPipe::Ending;

std::string lines(std::size_t count, std::size_t length) {
    std::string text;
    for (std::size_t i = 0; i < count; ++i) {
        text += std::string(length - 1, static_cast<char>('a' + i % 26)) + "\n";
    }
    return text;
}

TEST(MemoryLogBlocks, EndAtTheFirstLineFeedFromTheirFiveHundredTwelfthByte) {
    struct Case {
        std::string text;
        std::vector<std::size_t> sizes;
    };
    const std::string longLine = std::string(2000, 'x') + "\n" + std::string(99, 'y') + "\n";
    const std::vector<Case> cases = {
        {"", {}},
        {lines(11, 100), {600, 500}},          // the line feed after byte 512 is byte 600
        {lines(1, 512), {512}},                // a line feed at byte 512 ends the block there
        {lines(1, 511), {511}},                // fewer than 512 bytes: one block, whatever it holds
        {std::string(1024, 'z'), {512, 512}},  // no line feed follows: 512 bytes
        {lines(1, 512) + lines(1, 88), {512, 88}},
        {longLine, {2001, 100}},  // a long line stays whole
    };
    for (const Case& c : cases) {
        std::vector<std::size_t> sizes;
        std::string joined;
        for (const auto block : Worker::cutIntoBlocks(c.text)) {
            sizes.push_back(block.size());
            joined += block;
        }
        EXPECT_EQ(sizes, c.sizes);
        EXPECT_EQ(joined, c.text);
    }

    test::ScopedMemoryLog log;
    Worker::logCapturedText(lines(11, 100));
    const auto logged = log->lines();
    ASSERT_EQ(logged.size(), 2u);
    EXPECT_EQ(logged[0].level, LogLevel::Error);
    EXPECT_EQ(logged[0].category, "default");
    EXPECT_NE(logged[0].text.find("WIRED LOG BLOCK 1\n" + lines(6, 100)), std::string::npos);
    EXPECT_NE(logged[1].text.find("WIRED LOG BLOCK 2\n" + lines(11, 100).substr(600)),
              std::string::npos);
}

TEST(MemoryLogFilter, KeepsLinesWithAFilterWordButNotProcessesWithoutWiredMemory) {
    const std::string none = "wired_mem          0           0           0        none";
    struct Case {
        std::string line;
        bool kept;
    };
    const std::vector<Case> cases = {
        {"  12 phys_mem 100 KiB", true},
        {"x cpu_time 00:00:01\n", true},
        {"x phys_footprint 9", true},
        {"RESOURCE pid phys_mem", true},
        {" wired_mem          4           4           4        some", true},
        {" " + none, false},
        // " cpu_time " is tested before " wired_mem ": the line stays.
        {" cpu_time  " + none, true},
        {"phys_mem at the start has no blank before it", false},
        {"x wired_mem\n", false},
        {"resource", false},
        {"", false},
    };
    for (const Case& c : cases) {
        EXPECT_EQ(Worker::lineIsKept(c.line), c.kept) << c.line;
    }
}

class AMemoryLogWorker : public ::testing::Test {
  protected:
    void SetUp() override {
        Worker::TEST_resetRateLimit();
        QVReportingStats::shared().TEST_reset();
        const auto defaults = Worker::readSettings(fake.preferences);
        processCommand = defaults.commands[0];
        kernelCommand = defaults.commands[1];
    }
    void TearDown() override { Worker::TEST_resetRateLimit(); }

    std::shared_ptr<QVReportingSession> testSession(ReporterID id = 3) {
        return test::makeSession(
            fake.platform, {.id = id, .pids = {99}, .serviceType = service::kTest, .start = true});
    }
    static std::shared_ptr<QVReportingSessionMessage> request(AudioEventType t = type::kMemoryLog) {
        return std::make_shared<QVReportingSessionMessage>(Dictionary{{"why", "leak"}},
                                                           category::kGeneric, t);
    }
    // The blocks logged so far, in order.
    std::vector<std::string> blocks() {
        std::vector<std::string> out;
        for (const auto& l : log->lines()) {
            const auto at = l.text.find("WIRED LOG BLOCK ");
            if (at != std::string::npos) {
                out.push_back(l.text.substr(at));
            }
        }
        return out;
    }

    test::ScopedWorkerClasses<Worker> workerClasses;
    test::FakePlatform fake;
    test::ScopedMemoryLog log;
    std::string processCommand;
    std::string kernelCommand;
};

TEST_F(AMemoryLogWorker, ExistsInTestSessionsEverywhereAndInAllSessionsOnInternalBuilds) {
    // Made with the session only where it applies then. (That a test session of a customer build
    // gets it at start: the memory-log end-to-end test.)
    fake.device.internalBuild = false;
    auto alarms = test::makeSession(
        fake.platform, {.id = 1, .pids = {99}, .serviceType = service::kAlarms, .start = true});
    EXPECT_EQ(alarms->workerInstanceCount(), 0u);
    EXPECT_EQ(QVReportingSession::initWithID(fake.platform, 2, {99})->workerInstanceCount(), 0u);

    test::setInternalBuild(fake.device, true);
    auto internal = QVReportingSession::initWithID(fake.platform, 3, {99});
    EXPECT_EQ(internal->workerInstanceCount(), 1u);
}

TEST_F(AMemoryLogWorker, CapturesBothListingsFilteringTheFirstOncePerFiveSecondsAcrossSessions) {
    fake.processLauncher.script(
        processCommand,
        {{"RESOURCE pid phys_mem\n", "   1 phys_mem 10 KiB cpu_time 0:01 init\n", "garbage\n",
          " wired_mem          0           0           0        none\n", "tail\x01 phys_mem "},
         {Ending::Exited, 0}});
    fake.processLauncher.script(
        kernelCommand, {{"slabinfo - version: 2.1\n", "kmalloc-64 10 20\n"}, {Ending::Exited, 0}});
    auto a = testSession(1);
    auto b = testSession(2);

    a->sendMessage(request(type::kGeneric));  // not a request
    EXPECT_TRUE(fake.processLauncher.launches().empty());

    a->sendMessage(request());
    EXPECT_EQ(fake.processLauncher.launches().size(), 2u);
    EXPECT_EQ(blocks(), (std::vector<std::string>{
                            "WIRED LOG BLOCK 1\nRESOURCE pid phys_mem\n   1 phys_mem 10 KiB "
                            "cpu_time 0:01 init\ntail? phys_mem \n",
                            "WIRED LOG BLOCK 1\nslabinfo - version: 2.1\nkmalloc-64 10 20\n"}));

    // Five seconds later exactly, in another session: still too soon.
    fake.clock.advance(5.0);
    b->sendMessage(request());
    EXPECT_EQ(fake.processLauncher.launches().size(), 2u);
    // A moment more and the same request, redundant now, is captured.
    fake.clock.advance(0.001);
    b->sendMessage(request());
    EXPECT_EQ(fake.processLauncher.launches().size(), 4u);
    // Measured from the last capture, not the first request.
    fake.clock.advance(3.0);
    a->sendMessage(request());
    EXPECT_EQ(fake.processLauncher.launches().size(), 4u);
}

TEST_F(AMemoryLogWorker, ReportsMissingToolsAndCutShortOnesAndUsesTheSettings) {
    fake.preferences.setValue(QVReportingMemoryLogSuite, QVReportingMemoryLogKeyProcessCommand,
                              "procmem");
    fake.preferences.setValue(QVReportingMemoryLogSuite, QVReportingMemoryLogKeyKernelCommand,
                              "kzone -l");
    fake.preferences.setValue(QVReportingMemoryLogSuite, QVReportingMemoryLogKeyTimeoutSeconds,
                              1000);
    fake.preferences.setValue(QVReportingMemoryLogSuite, QVReportingMemoryLogKeyMaxOutputBytes, 10);
    // procmem is not there at all; kzone hangs after one line and is killed.
    fake.processLauncher.script("procmem", {{}, {}, ENOENT});
    fake.processLauncher.script("kzone -l", {{"zone 1\n"}, {Ending::TimedOut, 0}});
    auto s = testSession();
    s->sendMessage(request());

    EXPECT_TRUE(log->contains("wiredlog: unable to execute 'procmem'"));
    EXPECT_FALSE(log->contains("wiredlog: request procmem captured"));
    EXPECT_TRUE(log->contains("wiredlog: request 'kzone -l' cut short: time-out"));
    EXPECT_EQ(blocks(), (std::vector<std::string>{"WIRED LOG BLOCK 1\nzone 1\n"}));
    EXPECT_EQ(QVReportingStats::shared().sinkLinesLost("memorylog"), 1u);
    const auto limits = fake.processLauncher.limits();
    ASSERT_EQ(limits.size(), 2u);
    EXPECT_EQ(limits[0].timeout, std::chrono::seconds(60));  // clamped
    EXPECT_EQ(limits[0].maxOutputBytes, 4096u);
    // (A tool the shell cannot find: the memory-log end-to-end test.)
}

}  // namespace
}  // namespace qv
