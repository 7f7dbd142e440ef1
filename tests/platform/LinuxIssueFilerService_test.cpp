#include "platform/linux/capture/LinuxIssueFilerService.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>
#include <nlohmann/json.hpp>

#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "fakes/FakeClock.h"
#include "fakes/Notes.h"
#include "fakes/SinkLines.h"
#include "fakes/TempDirectory.h"
#include "fakes/WaitUntil.h"

namespace qv {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

IssueDraft sampleDraft() {
    IssueDraft draft;
    draft.title = "Invalid x/y coordinates during a Vidcall call (ITF)";
    draft.problemDescription = "Something went wrong.";
    draft.component = {"Vidcall Core - Callwire", "All", 1174093};
    draft.reproducibility = 6;
    draft.classification = 7;
    draft.diagnosticExtensionIdentifiers = {"com.korvane.DiagnosticExtensions.audio"};
    return draft;
}

// A unix socket that listens at path and never answers.
int listeningSocket(const fs::path& path) {
    fs::create_directories(path.parent_path());
    const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::snprintf(addr.sun_path, sizeof addr.sun_path, "%s", path.c_str());
    if (::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 || ::listen(fd, 4) != 0) {
        ::close(fd);
        return -1;
    }
    return fd;
}

// A program started for the test, with its standard output readable line by line; killed when
// the object goes. The shell says its own pid, which exec hands on to the program.
class Spawned {
  public:
    explicit Spawned(const std::string& command)
        // dbus-daemon complains that it may not raise its descriptor limit here.
        : out_(::popen(("echo $$; exec " + command + " 2>/dev/null").c_str(), "re")),
          pid_(std::atoi(readLine().c_str())) {}
    ~Spawned() {
        if (pid_ > 0) {
            ::kill(pid_, SIGKILL);
        }
        if (out_ != nullptr) {
            ::pclose(out_);
        }
    }
    Spawned(const Spawned&) = delete;
    Spawned& operator=(const Spawned&) = delete;

    // The next line of output without its line break; empty at the end.
    std::string readLine() {
        char buffer[1024];
        if (out_ == nullptr || ::fgets(buffer, sizeof buffer, out_) == nullptr) {
            return "";
        }
        std::string line(buffer);
        line.erase(line.find_last_not_of('\n') + 1);
        return line;
    }

  private:
    FILE* out_;
    pid_t pid_;
};

class TheLinuxIssueFilerService : public ::testing::Test {
  protected:
    std::unique_ptr<LinuxIssueFilerService> make(std::optional<std::string> address,
                                                 std::chrono::milliseconds timeout = 2000ms,
                                                 std::size_t maxPending = 16) {
        return std::make_unique<LinuxIssueFilerService>(
            std::make_unique<JsonlSink>(state.path().string(),
                                        std::string(LinuxIssueFilerService::kSinkName), clock,
                                        SinkCallbacks{}),
            LinuxIssueFilerService::Options{.sessionBusAddress = std::move(address),
                                            .notifyTimeout = timeout,
                                            .maxPendingPrompts = maxPending,
                                            .notice = notices.callback()});
    }
    LinuxIssueFilerService::Completion recorder() {
        return [this](const std::optional<std::string>& error) {
            std::lock_guard lock(mutex);
            completions.push_back({error, std::this_thread::get_id()});
        };
    }
    std::vector<nlohmann::ordered_json> sinkLines(std::string_view op = {}) const {
        return test::readSinkLines(state / "sinks/issuefiler.jsonl", op);
    }

    // A private session bus, or nothing where dbus-daemon or python's D-Bus modules are missing.
    std::optional<std::string> startBus() {
        if (!fs::exists("/usr/bin/dbus-daemon") ||
            std::system("/usr/bin/python3 -c 'import dbus, gi' 2>/dev/null") != 0) {
            return std::nullopt;
        }
        bus =
            std::make_unique<Spawned>("/usr/bin/dbus-daemon --session --nofork --print-address=1");
        std::string address = bus->readLine();
        if (address.empty()) {
            return std::nullopt;
        }
        return address;
    }
    bool startNotifications(const std::string& address, const std::string& mode) {
        const fs::path script = fs::path(QV_SOURCE_DIR) / "tests/e2e/notification_server.py";
        server =
            std::make_unique<Spawned>("/usr/bin/python3 '" + script.string() + "' '" + address +
                                      "' '" + (state / "notified.jsonl").string() + "' " + mode);
        return server->readLine() == "ready";
    }

    test::TempDirectory state{"qv-issuefiler"};
    test::FakeClock clock;
    std::mutex mutex;
    test::Notes notices;
    struct Completed {
        std::optional<std::string> error;
        std::thread::id thread;
    };
    std::vector<Completed> completions;
    std::unique_ptr<Spawned> bus;
    std::unique_ptr<Spawned> server;
};

TEST_F(TheLinuxIssueFilerService, FindsTheUsersSessionBusFromTheEnvironmentOrTheRuntimeSocket) {
    EXPECT_EQ(LinuxIssueFilerService::sessionBusAddressFor("unix:path=/x", 7, state.path()),
              "unix:path=/x");
    EXPECT_EQ(LinuxIssueFilerService::sessionBusAddressFor("", 7, state.path()), std::nullopt);
    fs::create_directories(state / "7");
    std::ofstream(state / "7/bus") << "not a socket";
    EXPECT_EQ(LinuxIssueFilerService::sessionBusAddressFor(nullptr, 7, state.path()), std::nullopt);
    const int fd = listeningSocket(state / "8/bus");
    EXPECT_EQ(LinuxIssueFilerService::sessionBusAddressFor(nullptr, 8, state.path()),
              "unix:path=" + (state / "8/bus").string());
    ::close(fd);
}

// What a draft line holds, and the prompts without a session bus: the diagnostics end-to-end
// tests. Here, the thread the completion comes on.
TEST_F(TheLinuxIssueFilerService, WithoutASessionBusCompletesOnItsOwnThread) {
    auto service = make(std::nullopt);
    service->createDraft(sampleDraft(), "vidcalld", "no bus here", recorder());
    service->flush();
    std::lock_guard lock(mutex);
    ASSERT_EQ(completions.size(), 1u);
    EXPECT_EQ(completions[0].error, std::nullopt);
    EXPECT_NE(completions[0].thread, std::this_thread::get_id());
}

TEST_F(TheLinuxIssueFilerService, PromptsThroughTheDesktopNotificationServiceWhenOneRuns) {
    const auto address = startBus();
    if (!address) {
        GTEST_SKIP() << "no dbus-daemon, or python3 lacks dbus and gi: no private session bus";
    }
    auto service = make(address);
    // No notification service yet: said so, and nothing is started for it.
    service->createDraft(sampleDraft(), "vidcalld", "first", recorder());
    service->flush();
    ASSERT_TRUE(startNotifications(*address, "answer"));
    service->createDraft(sampleDraft(), "vid<b>call\xff",
                         "a Vidcall spatial positioning error occurred", recorder());
    service->flush();

    const auto prompts = sinkLines("prompt");
    ASSERT_EQ(prompts.size(), 2u);
    EXPECT_EQ(prompts[0]["shown"], false);
    EXPECT_EQ(prompts[0]["reason"], "no notification service on the session bus");
    EXPECT_EQ(prompts[1]["notification"], 1);

    const auto notified = test::readSinkLines(state / "notified.jsonl");
    ASSERT_EQ(notified.size(), 1u);
    EXPECT_EQ(notified[0]["app_name"], "qvreportd");
    EXPECT_EQ(notified[0]["body"],
              "vid&lt;b&gt;call\xEF\xBF\xBD: a Vidcall spatial positioning error occurred. A bug "
              "report draft is waiting to be filed.");
    EXPECT_EQ(notified[0]["hints"]["urgency"], 1);
    EXPECT_EQ(notified[0]["expire_timeout"], -1);
    std::lock_guard lock(mutex);
    ASSERT_EQ(completions.size(), 2u);
    EXPECT_EQ(completions[1].error, std::nullopt);
    EXPECT_NE(completions[1].thread, std::this_thread::get_id()) << "on the service's thread";
}

TEST_F(TheLinuxIssueFilerService, GivesUpOnANotificationServiceThatHangsWithoutPilingUpPrompts) {
    const auto address = startBus();
    if (!address) {
        GTEST_SKIP() << "no dbus-daemon, or python3 lacks dbus and gi: no private session bus";
    }
    ASSERT_TRUE(startNotifications(*address, "hang"));
    // The first prompt is in the service's hands before the others are posted, so what follows
    // does not depend on how fast the service's thread runs: one prompt hangs, one waits behind
    // it, two are refused; the hang and the waiting one time out.
    auto service = make(address, 2000ms, 1);
    service->createDraft(sampleDraft(), "vidcalld", "hung", recorder());
    ASSERT_TRUE(test::waitUntil([&] {
        std::ifstream in(state / "notified.jsonl");
        return std::count(std::istreambuf_iterator<char>(in), {}, '\n') == 1;
    })) << "the notification service never heard of the first prompt";
    for (int i = 0; i < 3; ++i) {
        service->createDraft(sampleDraft(), "vidcalld", "hung", recorder());
    }
    service->flush();

    EXPECT_EQ(sinkLines("draft").size(), 4u);
    std::map<int, std::string> reasons;
    for (const auto& p : sinkLines("prompt")) {
        EXPECT_EQ(p["shown"], false);
        EXPECT_TRUE(reasons.emplace(p["draft"].get<int>(), p["reason"]).second)
            << "one prompt line per draft";
    }
    const std::string timedOut = "the notification service did not answer within 2000 ms";
    const std::string refused = "1 prompts are already waiting";
    EXPECT_EQ(reasons, (std::map<int, std::string>{
                           {1, timedOut}, {2, timedOut}, {3, refused}, {4, refused}}));
    {
        std::lock_guard lock(mutex);
        EXPECT_EQ(completions.size(), 4u) << "every completion runs once";
        EXPECT_EQ(notices.lines(),
                  (std::vector<std::string>{"issue filer: no prompt shown: " + refused,
                                            "issue filer: no prompt shown: " + timedOut}))
            << "the overflow and the hang, each once";
    }

    // A bus that takes the connection and then says nothing is given up on in time too.
    const fs::path silent = state / "silent";
    const int fd = listeningSocket(silent);
    ASSERT_GE(fd, 0);
    auto mute = make("unix:path=" + silent.string(), 300ms);
    mute->createDraft(sampleDraft(), "vidcalld", "mute", {});
    mute->flush();
    ::close(fd);
    const auto last = sinkLines("prompt").back();
    EXPECT_EQ(last["reason"],
              "the session bus at unix:path=" + silent.string() + " did not let us in in time");
}

}  // namespace
}  // namespace qv
