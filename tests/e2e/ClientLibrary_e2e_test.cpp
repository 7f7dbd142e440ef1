// The client library against the real qvreportd on a private bus.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "QVReportingClient.h"

namespace qv::client {
namespace {

using namespace std::chrono_literals;

// Waits for a condition, not for a while.
bool waitUntil(const std::function<bool()>& condition, std::chrono::seconds timeout = 10s) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (!condition()) {
        if (std::chrono::steady_clock::now() > deadline) {
            return false;
        }
        std::this_thread::sleep_for(10ms);
    }
    return true;
}

pid_t spawn(const std::vector<std::string>& args, int outFd = -1, int errFd = -1) {
    const pid_t pid = fork();
    if (pid == 0) {
        if (outFd >= 0)
            dup2(outFd, 1);
        if (errFd >= 0)
            dup2(errFd, 2);
        std::vector<char*> argv;
        for (const auto& a : args)
            argv.push_back(const_cast<char*>(a.c_str()));
        argv.push_back(nullptr);
        execvp(argv[0], argv.data());
        _exit(127);
    }
    return pid;
}

std::size_t countLines(const std::filesystem::path& file, const std::string& needle) {
    std::ifstream in(file);
    std::size_t n = 0;
    for (std::string line; std::getline(in, line);) {
        n += line.find(needle) != std::string::npos ? 1 : 0;
    }
    return n;
}

class TheClientLibrary : public ::testing::Test {
  protected:
    void SetUp() override {
        work_ = std::filesystem::temp_directory_path() /
                ("qv-client-e2e-" + std::to_string(getpid()) + "-" +
                 ::testing::UnitTest::GetInstance()->current_test_info()->name());
        std::filesystem::create_directories(work_ / "state");
        int fds[2];
        ASSERT_EQ(pipe(fds), 0);
        const int devnull = ::open("/dev/null", O_WRONLY);
        bus_ =
            spawn({"dbus-daemon", "--session", "--nofork", "--print-address=1"}, fds[1], devnull);
        ::close(fds[1]);
        char buf[512] = {};
        const auto n = ::read(fds[0], buf, sizeof buf - 1);
        ::close(fds[0]);
        address_.assign(buf, n > 0 ? static_cast<std::size_t>(n) : 0);
        address_.erase(address_.find_last_not_of('\n') + 1);
        ASSERT_FALSE(address_.empty());
        const int log = ::open((work_ / "qvreportd.log").c_str(), O_WRONLY | O_CREAT, 0644);
        daemon_ = spawn({QVREPORTD_PATH, "--bus", address_, "--state-dir",
                         (work_ / "state").string(), "--log-level", "debug"},
                        log, log);
        ::close(log);
        ::close(devnull);
        ASSERT_TRUE(waitUntil([&] {
            std::ifstream in(work_ / "qvreportd.log");
            std::string text((std::istreambuf_iterator<char>(in)), {});
            return text.find("owning bus name") != std::string::npos;
        })) << "the daemon did not come up";
    }
    void TearDown() override {
        stopDaemon();
        kill(bus_, SIGTERM);
        waitpid(bus_, nullptr, 0);
        std::filesystem::remove_all(work_);
    }
    int stopDaemon() {
        if (daemon_ <= 0)
            return -1;
        kill(daemon_, SIGTERM);
        int status = 0;
        waitpid(daemon_, &status, 0);
        daemon_ = 0;
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    }
    std::filesystem::path analytics() const {
        return work_ / "state" / "sinks" / "analytics.jsonl";
    }

    std::filesystem::path work_;
    std::string address_;
    pid_t bus_ = 0;
    pid_t daemon_ = 0;
};

TEST_F(TheClientLibrary, HearsTheHeldStartReplyWhenTheSessionStops) {
    auto client = QVReportingClient::connectToAddress(address_);
    ASSERT_TRUE(client->createReportingSession(5));
    std::atomic<int> answers{0};
    std::atomic<bool> result{false};
    client->startReportingSessionAsync(5, [&](const QVReportingClientError* e, bool r) {
        result = !e && r;
        ++answers;
    });
    client->sendMessage({{"volume", sdbus::Variant(0.25)}}, 4, 1, {5});
    EXPECT_EQ(client->getAllReporters(), std::vector<std::int64_t>{5});
    EXPECT_EQ(answers.load(), 0);  // the session runs: no answer yet
    EXPECT_TRUE(client->stopReportingSession(5));
    ASSERT_TRUE(waitUntil([&] { return answers.load() == 1; }));
    EXPECT_TRUE(result.load());
}

TEST_F(TheClientLibrary, ServesTwoClientsSendingAtOnce) {
    auto a = QVReportingClient::connectToAddress(address_);
    auto b = QVReportingClient::connectToAddress(address_);
    ASSERT_TRUE(a->createReportingSession(1));
    ASSERT_TRUE(b->createReportingSession(2));
    a->startReportingSessionAsync(1, [](auto, bool) {});
    b->startReportingSessionAsync(2, [](auto, bool) {});
    // Each client's payloads are made up front, on one thread, and used by that client's thread
    // alone: sdbus-c++ Variants are neither made nor serialised safely on two threads at once.
    using Payloads = std::vector<std::map<std::string, sdbus::Variant>>;
    auto makePayloads = [] {
        Payloads payloads;
        for (int i = 0; i < 300; ++i) {
            payloads.push_back({{"i", sdbus::Variant(std::int64_t{i})}});
        }
        return payloads;
    };
    const Payloads forA = makePayloads(), forB = makePayloads();
    auto sendMany = [](QVReportingClient& c, std::int64_t id, const Payloads& payloads) {
        std::atomic<int> done{0};
        for (const auto& payload : payloads) {
            c.sendMessageAsync(payload, 1, 0, {id},
                               [&](const QVReportingClientError* e) { done += e ? 1000 : 1; });
        }
        return waitUntil([&] { return done.load() >= 300; }) && done.load() == 300;
    };
    bool okA = false, okB = false;
    std::thread ta([&] { okA = sendMany(*a, 1, forA); });
    std::thread tb([&] { okB = sendMany(*b, 2, forB); });
    ta.join();
    tb.join();
    EXPECT_TRUE(okA && okB);
    EXPECT_TRUE(a->stopReportingSession(1));
    EXPECT_TRUE(b->stopReportingSession(2));
    EXPECT_EQ(stopDaemon(), 0);
    EXPECT_EQ(countLines(analytics(), "\"event\":\"com.korvane.qvsound.Generic.Generic\""), 600u);
}

TEST_F(TheClientLibrary, GetsItsHeldStartAnsweredWhenTheDaemonStopsNormally) {
    auto client = QVReportingClient::connectToAddress(address_);
    ASSERT_TRUE(client->createReportingSession(9));
    std::atomic<int> answers{0};
    client->startReportingSessionAsync(
        9, [&](const QVReportingClientError* e, bool r) { answers += (!e && r) ? 1 : 100; });
    client->getAllReporters();  // the start is on the daemon's queue before this answers
    EXPECT_EQ(stopDaemon(), 0);
    ASSERT_TRUE(waitUntil([&] { return answers.load() > 0; }));
    EXPECT_EQ(answers.load(), 1);
}

TEST_F(TheClientLibrary, SaysClearlyWhenTheDaemonIsNotRunning) {
    stopDaemon();
    auto client = QVReportingClient::connectToAddress(address_);
    try {
        client->getAllReporters();
        FAIL() << "a call without a daemon succeeded";
    } catch (const QVReportingClientError& e) {
        EXPECT_TRUE(e.isDaemonNotRunning()) << e.name() << ": " << e.message();
    }
}

TEST_F(TheClientLibrary, LosesItsSessionsWhenItsConnectionCloses) {
    auto observer = QVReportingClient::connectToAddress(address_);
    {
        auto client = QVReportingClient::connectToAddress(address_);
        ASSERT_TRUE(client->createReportingSession(77));
        ASSERT_TRUE(client->setServiceType(7, 77));
        EXPECT_EQ(observer->getServiceNameForReporterID(77), 65535);  // not observer's own
    }
    ASSERT_TRUE(waitUntil([&] { return observer->getAllReporters().empty(); }));
}

}  // namespace
}  // namespace qv::client
