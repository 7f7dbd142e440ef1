// End-to-end load on the daemon over a private bus, next to the physical limit of that bus.
//
//   build/release/bench/qv_load_generator --daemon build/release/qvreportd
//
// It starts a private dbus-daemon, the real qvreportd on a temporary state directory, and a
// trivial server (this program again, with --trivial-server) whose SendMessage has the daemon's
// signature and discards its arguments. Then, for 1, 4 and 16 clients, it sends ten-key payloads
// to started sessions one call at a time and pipelined (64 calls in flight per client), first to
// the trivial server and then to the daemon, and prints messages per second and latency
// percentiles. Last, it sends 10^6 messages through sessions that are stopped and destroyed and
// compares the daemon's resident set size before and after.
//
// Each client owns one connection and drives it from one thread: calls, replies and the poll loop
// all happen there, so no bus connection is shared between threads.
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include <sdbus-c++/sdbus-c++.h>

#include "QVReportingDBusNames.h"

namespace {

using Clock = std::chrono::steady_clock;
using Payload = std::map<std::string, sdbus::Variant>;

constexpr const char* kTrivialName = "com.korvane.qvsound.TrivialReporting";
constexpr std::size_t kPipelineDepth = 64;

struct Target {
    std::string busName;
    bool hasSessions;
};

Payload payload(std::int64_t seq) {
    return Payload{
        {"session_selected_format", sdbus::Variant(std::string("lpcm-48000-2ch-f32"))},
        {"active_devices", sdbus::Variant(std::string("Speaker"))},
        {"KXSessionVolume", sdbus::Variant(0.5)},
        {"session_output_running", sdbus::Variant(true)},
        {"mChannelsPerFrame", sdbus::Variant(std::int32_t{2})},
        {"sequence", sdbus::Variant(seq)},
        {"route", sdbus::Variant(std::string("BuiltInSpeaker"))},
        {"latency_ms", sdbus::Variant(11.6)},
        {"buffer_frames", sdbus::Variant(std::uint32_t{512})},
        {"format", sdbus::Variant(Payload{{"rate", sdbus::Variant(std::int32_t{48000})}})},
    };
}

// One client: a connection and a proxy, driven by the calling thread only.
class Client {
  public:
    Client(const std::string& address, const Target& target)
        : connection_(sdbus::createSessionBusConnectionWithAddress(address)),
          proxy_(sdbus::createProxy(*connection_, target.busName, qv::dbus::kObjectPath)),
          target_(target) {}

    void beginSession(std::int64_t id) {
        if (!target_.hasSessions) {
            return;
        }
        call(qv::dbus::kCreateReportingSession, id);
        // The start reply is held until the session stops: send it without waiting.
        auto start =
            proxy_->createMethodCall(qv::dbus::kInterface, qv::dbus::kStartReportingSession);
        start << id;
        pendingStart_ = proxy_->callMethod(
            start, [](sdbus::MethodReply&, const sdbus::Error*) {}, std::uint64_t{600} * 1000000);
        pump(false);
    }

    void endSession(std::int64_t id) {
        if (!target_.hasSessions) {
            return;
        }
        call(qv::dbus::kStopReportingSession, id);
        call(qv::dbus::kDestroyReportingSession, id);
        pump(false);
    }

    // Sends count messages one call at a time; appends each call's latency in microseconds.
    void sendSerial(std::int64_t id, std::int64_t count, std::vector<double>& latencies) {
        for (std::int64_t i = 0; i < count; ++i) {
            auto m = makeSend(id, i);
            const auto t0 = Clock::now();
            proxy_->callMethod(m);
            latencies.push_back(micros(Clock::now() - t0));
        }
    }

    // Sends count messages keeping kPipelineDepth calls in flight.
    void sendPipelined(std::int64_t id, std::int64_t count, std::vector<double>& latencies) {
        std::int64_t sent = 0, done = 0;
        std::size_t inFlight = 0;
        std::vector<sdbus::PendingAsyncCall> calls;
        while (done < count) {
            while (inFlight < kPipelineDepth && sent < count) {
                auto m = makeSend(id, sent++);
                const auto t0 = Clock::now();
                ++inFlight;
                proxy_->callMethod(
                    m,
                    [&, t0](sdbus::MethodReply&, const sdbus::Error* error) {
                        if (error) {
                            ++errors_;
                        }
                        latencies.push_back(micros(Clock::now() - t0));
                        --inFlight;
                        ++done;
                    },
                    std::uint64_t{30} * 1000000);
            }
            pump(true);
        }
    }

    std::uint64_t errors() const { return errors_; }

  private:
    static double micros(Clock::duration d) {
        return std::chrono::duration<double, std::micro>(d).count();
    }

    sdbus::MethodCall makeSend(std::int64_t id, std::int64_t seq) {
        auto m = proxy_->createMethodCall(qv::dbus::kInterface, qv::dbus::kSendMessage);
        m << payload(seq) << std::uint32_t{4} << std::uint16_t{1} << std::vector<std::int64_t>{id};
        return m;
    }

    void call(const char* member, std::int64_t id) {
        auto m = proxy_->createMethodCall(qv::dbus::kInterface, member);
        m << id;
        proxy_->callMethod(m);
    }

    // Processes what is pending; with wait, first waits for the bus to have something.
    void pump(bool wait) {
        while (connection_->processPendingRequest()) {
        }
        if (!wait) {
            return;
        }
        const auto data = connection_->getEventLoopPollData();
        pollfd fd{data.fd, data.events, 0};
        ::poll(&fd, 1, 100);
        while (connection_->processPendingRequest()) {
        }
    }

    std::unique_ptr<sdbus::IConnection> connection_;
    std::unique_ptr<sdbus::IProxy> proxy_;
    Target target_;
    sdbus::PendingAsyncCall pendingStart_;
    std::uint64_t errors_ = 0;
};

struct Result {
    double messagesPerSecond = 0;
    double p50 = 0, p99 = 0;
    std::uint64_t errors = 0;
};

double percentile(std::vector<double>& v, double p) {
    if (v.empty()) {
        return 0;
    }
    const auto k = static_cast<std::size_t>(p * static_cast<double>(v.size() - 1));
    std::nth_element(v.begin(), v.begin() + static_cast<std::ptrdiff_t>(k), v.end());
    return v[k];
}

Result run(const std::string& address, const Target& target, int clients, bool pipelined,
           std::int64_t perClient, std::int64_t firstID) {
    std::vector<std::vector<double>> latencies(static_cast<std::size_t>(clients));
    std::vector<std::unique_ptr<Client>> made;
    for (int c = 0; c < clients; ++c) {
        made.push_back(std::make_unique<Client>(address, target));
        made.back()->beginSession(firstID + c);
    }
    std::atomic<int> ready{0};
    std::atomic<bool> go{false};
    std::vector<std::thread> threads;
    for (int c = 0; c < clients; ++c) {
        threads.emplace_back([&, c] {
            auto& l = latencies[static_cast<std::size_t>(c)];
            l.reserve(static_cast<std::size_t>(perClient));
            ++ready;
            while (!go) {
                std::this_thread::yield();
            }
            auto& client = *made[static_cast<std::size_t>(c)];
            pipelined ? client.sendPipelined(firstID + c, perClient, l)
                      : client.sendSerial(firstID + c, perClient, l);
        });
    }
    while (ready < clients) {
        std::this_thread::yield();
    }
    const auto t0 = Clock::now();
    go = true;
    for (auto& t : threads) {
        t.join();
    }
    const double seconds = std::chrono::duration<double>(Clock::now() - t0).count();
    Result r;
    std::vector<double> all;
    for (int c = 0; c < clients; ++c) {
        all.insert(all.end(), latencies[static_cast<std::size_t>(c)].begin(),
                   latencies[static_cast<std::size_t>(c)].end());
        r.errors += made[static_cast<std::size_t>(c)]->errors();
        made[static_cast<std::size_t>(c)]->endSession(firstID + c);
    }
    r.messagesPerSecond = static_cast<double>(all.size()) / seconds;
    r.p50 = percentile(all, 0.50);
    r.p99 = percentile(all, 0.99);
    return r;
}

// Starts a program; returns its PID. With outFd, the child's stdout goes there.
pid_t spawn(const std::vector<std::string>& args, int outFd = -1) {
    const pid_t pid = fork();
    if (pid == 0) {
        if (outFd >= 0) {
            dup2(outFd, 1);
        }
        std::vector<char*> argv;
        for (const auto& a : args) {
            argv.push_back(const_cast<char*>(a.c_str()));
        }
        argv.push_back(nullptr);
        execvp(argv[0], argv.data());
        _exit(127);
    }
    return pid;
}

long rssKiB(pid_t pid) {
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    while (std::getline(status, line)) {
        if (line.rfind("VmRSS:", 0) == 0) {
            return std::stol(line.substr(6));
        }
    }
    return -1;
}

bool waitForName(const std::string& address, const std::string& name) {
    auto connection = sdbus::createSessionBusConnectionWithAddress(address);
    auto bus = sdbus::createProxy(*connection, "org.freedesktop.DBus", "/org/freedesktop/DBus");
    for (int i = 0; i < 200; ++i) {
        bool has = false;
        bus->callMethod("NameHasOwner")
            .onInterface("org.freedesktop.DBus")
            .withArguments(name)
            .storeResultsTo(has);
        if (has) {
            return true;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    return false;
}

int trivialServer(const std::string& address) {
    auto connection = sdbus::createSessionBusConnectionWithAddress(address);
    auto object = sdbus::createObject(*connection, qv::dbus::kObjectPath);
    object->registerMethod(qv::dbus::kInterface, qv::dbus::kSendMessage, "a{sv}uqax", "",
                           [](sdbus::MethodCall call) { call.createReply().send(); });
    object->finishRegistration();
    connection->requestName(kTrivialName);
    connection->enterEventLoop();
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    std::string daemon;
    std::int64_t total = 200000;
    bool memoryOnly = false;
    for (int i = 1; i < argc; ++i) {
        const std::string a = argv[i];
        if (a == "--trivial-server" && i + 1 < argc) {
            return trivialServer(argv[i + 1]);
        }
        if (a == "--daemon" && i + 1 < argc) {
            daemon = argv[++i];
        } else if (a == "--messages" && i + 1 < argc) {
            total = std::stoll(argv[++i]);
        } else if (a == "--memory-only") {
            memoryOnly = true;
        } else {
            std::fprintf(stderr,
                         "usage: %s --daemon PATH/qvreportd [--messages N] [--memory-only]\n"
                         "  N: messages per pipelined workload (default 200000; serial ones "
                         "send a tenth)\n"
                         "  --memory-only: only the memory check, not the throughput table\n",
                         argv[0]);
            return 2;
        }
    }
    if (daemon.empty()) {
        std::fprintf(stderr, "--daemon PATH/qvreportd is required (see --help)\n");
        return 2;
    }
    signal(SIGPIPE, SIG_IGN);
    std::setvbuf(stdout, nullptr, _IOLBF, 0);  // rows appear as they are measured

    int pipeFds[2];
    if (pipe(pipeFds) != 0) {
        return 1;
    }
    const pid_t bus =
        spawn({"dbus-daemon", "--session", "--nofork", "--print-address=1"}, pipeFds[1]);
    close(pipeFds[1]);
    char buf[512] = {};
    const auto n = read(pipeFds[0], buf, sizeof buf - 1);
    std::string address(buf, n > 0 ? static_cast<std::size_t>(n) : 0);
    address.erase(address.find_last_not_of("\n") + 1);

    const auto stateDir =
        std::filesystem::temp_directory_path() / ("qv-load-" + std::to_string(getpid()));
    std::filesystem::create_directories(stateDir);
    const pid_t qv =
        spawn({daemon, "--bus", address, "--state-dir", stateDir.string(), "--log-level", "error"});
    const pid_t trivial = spawn({argv[0], "--trivial-server", address});
    if (!waitForName(address, qv::dbus::kBusName) || !waitForName(address, kTrivialName)) {
        std::fprintf(stderr, "the daemon or the trivial server did not come up\n");
        kill(qv, SIGKILL);
        kill(trivial, SIGKILL);
        kill(bus, SIGKILL);
        return 1;
    }

    const Target trivialTarget{kTrivialName, false};
    const Target daemonTarget{qv::dbus::kBusName, true};
    std::printf("%-8s %-10s %-8s %12s %10s %10s %12s %10s %10s\n", "clients", "mode", "", "msg/s",
                "p50 us", "p99 us", "trivial/s", "p99 us", "ratio");
    std::int64_t nextID = 1000;
    bool allMet = true;
    for (int clients : {1, 4, 16}) {
        for (bool pipelined : {false, true}) {
            if (memoryOnly) {
                break;
            }
            const std::int64_t perClient = (pipelined ? total : total / 10) / clients;
            const Result t = run(address, trivialTarget, clients, pipelined, perClient, nextID);
            const Result d = run(address, daemonTarget, clients, pipelined, perClient, nextID);
            nextID += clients;
            const double ratio = d.messagesPerSecond / t.messagesPerSecond;
            std::printf("%-8d %-10s %-8s %12.0f %10.1f %10.1f %12.0f %10.1f %10.2f%s\n", clients,
                        pipelined ? "pipelined" : "serial", "", d.messagesPerSecond, d.p50, d.p99,
                        t.messagesPerSecond, t.p99, ratio,
                        d.errors + t.errors ? "  (errors!)" : "");
            if (pipelined && (ratio < 0.7 || d.p99 > 2 * t.p99)) {
                allMet = false;
            }
        }
    }

    // Memory: 10^6 messages through sessions that are stopped and destroyed. The daemon hands
    // freed memory back to the system on a timer of 5 s: both readings wait a little longer.
    const auto settledRss = [qv] {
        std::this_thread::sleep_for(std::chrono::seconds(6));
        return rssKiB(qv);
    };
    const int clients = 16;
    const std::int64_t perSession = 10000;
    const std::int64_t rounds = 1000000 / (clients * perSession);
    // One round first, so that "before" is a daemon that has served sessions (its thread arenas,
    // worker registry and sink buffers exist), not one that has never been used.
    const long untouched = rssKiB(qv);
    run(address, daemonTarget, clients, true, perSession, nextID);
    nextID += clients;
    const long before = settledRss();
    for (std::int64_t r = 0; r < rounds; ++r) {
        run(address, daemonTarget, clients, true, perSession, nextID);
        nextID += clients;
    }
    const long atOnce = rssKiB(qv);
    const long after = settledRss();
    std::printf(
        "\nRSS %ld KiB when the memory check began, %ld KiB after one round (before); after "
        "%lld messages in stopped sessions %ld KiB at once, %ld KiB settled (%+.1f%%)\n",
        untouched, before, static_cast<long long>(rounds * clients * perSession), atOnce, after,
        100.0 * static_cast<double>(after - before) / static_cast<double>(before));
    const bool memoryMet = after <= before * 11 / 10;
    if (memoryOnly) {
        std::printf("target (RSS within 10%%): %s\n", memoryMet ? "met" : "NOT met");
    } else {
        std::printf(
            "targets (pipelined: >= 0.7x trivial msg/s, p99 <= 2x trivial; RSS within 10%%): "
            "%s\n",
            allMet && memoryMet ? "met" : "NOT met");
    }

    kill(trivial, SIGTERM);
    kill(qv, SIGTERM);
    int status = 0;
    waitpid(qv, &status, 0);
    waitpid(trivial, nullptr, 0);
    kill(bus, SIGTERM);
    waitpid(bus, nullptr, 0);
    std::filesystem::remove_all(stateDir);
    return 0;
}
