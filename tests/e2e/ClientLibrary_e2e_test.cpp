// The client library against the real qvreportd on a private bus.
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
#include "fakes/TempDirectory.h"
#include "fakes/WaitUntil.h"

namespace qv::client {
namespace {

using namespace std::chrono_literals;

using qv::test::waitUntil;

class TheClientLibrary : public ::testing::Test {
  protected:
    void SetUp() override {
        std::filesystem::create_directories(work_ / "state");
        FILE* bus = popen("dbus-daemon --session --fork --print-address=1 --print-pid=1", "r");
        ASSERT_NE(bus, nullptr);
        char address[512] = {}, pid[32] = {};
        const bool read = fgets(address, sizeof address, bus) && fgets(pid, sizeof pid, bus);
        pclose(bus);
        ASSERT_TRUE(read);
        address_ = address;
        address_.erase(address_.find_last_not_of('\n') + 1);
        bus_ = std::stoi(pid);
        daemon_ = fork();
        if (daemon_ == 0) {
            execl(QVREPORTD_PATH, QVREPORTD_PATH, "--bus", address_.c_str(), "--state-dir",
                  (work_ / "state").c_str(), "--direct-socket", (work_ / "direct").c_str(),
                  static_cast<char*>(nullptr));
            _exit(127);
        }
        ASSERT_TRUE(waitUntil([&] {
            try {
                QVReportingClient::connectToAddress(address_)->getAllReporters();
                return true;
            } catch (const std::exception&) {
                return false;
            }
        })) << "the daemon did not come up";
    }
    void TearDown() override {
        stopDaemon();
        kill(bus_, SIGTERM);
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

    test::TempDirectory tmp_{"qv-client-e2e"};
    const std::filesystem::path work_ = tmp_.path();
    std::string address_;
    pid_t bus_ = 0;
    pid_t daemon_ = 0;
};

TEST_F(TheClientLibrary, HearsTheHeldStartReplyWhenTheSessionStopsOrTheDaemonStops) {
    auto client = QVReportingClient::connectToAddress(address_);
    ASSERT_TRUE(client->createReportingSession(5));
    ASSERT_TRUE(client->createReportingSession(9));
    std::atomic<int> answers5{0}, answers9{0};
    client->startReportingSessionAsync(
        5, [&](const QVReportingClientError* e, bool r) { answers5 += (!e && r) ? 1 : 100; });
    client->startReportingSessionAsync(
        9, [&](const QVReportingClientError* e, bool r) { answers9 += (!e && r) ? 1 : 100; });
    client->sendMessage({{"volume", sdbus::Variant(0.25)}}, 4, 1, {5});
    EXPECT_EQ(client->getAllReporters(), (std::vector<std::int64_t>{5, 9}));
    EXPECT_EQ(answers5.load(), 0);  // the session runs: no answer yet
    EXPECT_TRUE(client->stopReportingSession(5));
    ASSERT_TRUE(waitUntil([&] { return answers5.load() > 0; }));
    EXPECT_EQ(answers5.load(), 1);
    EXPECT_EQ(answers9.load(), 0);
    EXPECT_EQ(stopDaemon(), 0);  // a normal stop answers the session still running
    ASSERT_TRUE(waitUntil([&] { return answers9.load() > 0; }));
    EXPECT_EQ(answers9.load(), 1);
}

TEST_F(TheClientLibrary, ServesTwoClientsSendingAtOnce) {
    auto a = QVReportingClient::connectToAddress(address_);
    auto b = QVReportingClient::connectToAddress(address_);
    ASSERT_TRUE(a->createReportingSession(1));
    ASSERT_TRUE(b->createReportingSession(2));
    a->startReportingSessionAsync(1, [](auto, bool) {});
    b->startReportingSessionAsync(2, [](auto, bool) {});
    // Payloads are made up front: sdbus-c++ Variants are not safe to make on two threads at once.
    using Payloads = std::vector<std::map<std::string, sdbus::Variant>>;
    Payloads forA, forB;
    for (std::int64_t i = 0; i < 300; ++i) {
        forA.push_back({{"i", sdbus::Variant(i)}});
        forB.push_back({{"i", sdbus::Variant(i)}});
    }
    auto sendMany = [](QVReportingClient& c, std::int64_t id, const Payloads& payloads) {
        std::atomic<int> done{0};
        for (const auto& payload : payloads) {
            c.sendMessageAsync(payload, 1, 0, {id},
                               [&](const QVReportingClientError* e) { done += e ? 1000 : 1; });
        }
        return waitUntil([&] { return done.load() >= 300; }) && done.load() == 300;
    };
    std::atomic<bool> okA = false;
    std::thread ta([&] { okA = sendMany(*a, 1, forA); });
    EXPECT_TRUE(sendMany(*b, 2, forB));  // at the same time as a
    ta.join();
    EXPECT_TRUE(okA);
    EXPECT_TRUE(a->stopReportingSession(1));
    EXPECT_TRUE(b->stopReportingSession(2));
    EXPECT_EQ(stopDaemon(), 0);
    std::ifstream in(work_ / "state" / "sinks" / "analytics.jsonl");
    std::size_t lines = 0;
    for (std::string line; std::getline(in, line);)
        lines += line.find("\"event\":\"com.korvane.qvsound.Generic.Generic\"") != line.npos;
    EXPECT_EQ(lines, 600u);
}

TEST_F(TheClientLibrary, SaysClearlyWhenTheDaemonIsNotRunning) {
    stopDaemon();
    try {
        QVReportingClient::connectToAddress(address_)->getAllReporters();
        FAIL() << "a call without a daemon succeeded";
    } catch (const QVReportingClientError& e) {
        EXPECT_TRUE(e.isDaemonNotRunning()) << e.name() << ": " << e.message();
    }
}

TEST_F(TheClientLibrary, TakesTheDirectSocketOutlivesTheDaemonOnItAndFallsBackToTheBus) {
    const std::string socket = (work_ / "direct").string();
    auto direct = QVReportingClient::connect(address_, QVReportingTransport::Auto, socket);
    auto held = QVReportingClient::connect(address_, QVReportingTransport::Direct, socket);
    auto overBus = QVReportingClient::connect(address_, QVReportingTransport::Bus, socket);
    EXPECT_TRUE(direct->isDirect());
    EXPECT_TRUE(held->isDirect());
    EXPECT_FALSE(overBus->isDirect());
    ASSERT_TRUE(held->createReportingSession(7));
    std::atomic<int> answered{0};
    std::string heard;
    held->startReportingSessionAsync(7, [&](const QVReportingClientError* e, bool) {
        heard = e ? e->name() : "a reply";
        ++answered;
    });
    EXPECT_EQ(overBus->getAllReporters(), (std::vector<std::int64_t>{7}));
    EXPECT_EQ(direct->daemonOwner(), overBus->daemonOwner());

    // Killed from the socket, the daemon takes its connections with it: a held call fails,
    // and nothing ends the client's process.
    direct->killService();
    waitpid(daemon_, nullptr, 0);
    daemon_ = 0;
    ASSERT_TRUE(waitUntil([&] { return answered.load() > 0; }));
    EXPECT_EQ(heard, "org.freedesktop.DBus.Error.NoReply");
    EXPECT_THROW(held->getAllReporters(), QVReportingClientError);

    // The socket it left answers nobody: auto takes the bus, direct says why it cannot.
    EXPECT_TRUE(std::filesystem::exists(socket));
    EXPECT_FALSE(
        QVReportingClient::connect(address_, QVReportingTransport::Auto, socket)->isDirect());
    EXPECT_THROW(QVReportingClient::connect(address_, QVReportingTransport::Direct, socket),
                 QVReportingClientError);
}

}  // namespace
}  // namespace qv::client
