// End-to-end load on the daemon, over a private bus and over its direct socket, next to the limit
// of the bus itself.
//
//   build/release/bench/qv_load_generator --daemon build/release/qvreportd
//
// It starts a private dbus-daemon, the real qvreportd on a temporary state directory (with its
// direct socket there), and a trivial server (this program again, with --trivial-server): plain
// sd-bus, whose SendMessage has the daemon's signature, reads the whole payload and answers at
// once. That is what a message costs the bus and its two ends when the server does no work: the
// transport's limit. Then, for 1, 4 and 16 clients, it sends ten-key payloads to started
// sessions one call at a time (serial) and with 64 calls in flight per client (pipelined): to the
// trivial server, to the daemon over the bus, and to the daemon over its direct socket. It prints
// one row each: messages per second and the 99th percentile of latency of the three, the daemon's
// ratios (over the bus to the trivial server, direct to over the bus), and the CPU time one
// message costs the whole path (the clients, the dbus-daemon where there is one, and the server),
// from /proc/PID/stat (with --cpu-split, under each row, that time by process). Last, unless
// --throughput-only, it sends 10^6 messages through sessions that are stopped and destroyed and
// compares the daemon's resident set size before and after.
//
// The clients are plain sd-bus as well, so that the figures are the servers' and the bus's, not a
// binding's. Each client owns one connection and drives it from one thread.
#include <poll.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <systemd/sd-bus.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <numeric>
#include <optional>
#include <sstream>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "QVReportingDBusNames.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr const char* kTrivialName = "com.korvane.qvsound.TrivialReporting";
constexpr std::size_t kPipelineDepth = 64;
constexpr std::uint64_t kCallTimeoutMicros = 30'000'000;

void check(int r, const char* what) {
    if (r < 0) {
        throw std::runtime_error(std::string(what) + ": " + std::strerror(-r));
    }
}

// Where clients connect: the bus (to a name), or the daemon's socket (peer to peer).
struct Endpoint {
    std::string address;
    const char* destination;  // null on a direct connection
    bool hasSessions;
};

// One client: a connection, driven by the calling thread only.
class Client {
  public:
    explicit Client(const Endpoint& endpoint) : endpoint_(endpoint) {
        check(sd_bus_new(&bus_), "sd_bus_new");
        check(sd_bus_set_address(bus_, endpoint.address.c_str()), "sd_bus_set_address");
        check(sd_bus_set_bus_client(bus_, endpoint.destination != nullptr), "bus client");
        check(sd_bus_start(bus_), "sd_bus_start");
    }
    ~Client() { sd_bus_flush_close_unref(bus_); }
    Client(const Client&) = delete;
    Client& operator=(const Client&) = delete;

    void beginSession(std::int64_t id) {
        if (!endpoint_.hasSessions) {
            return;
        }
        call(qv::dbus::kCreateReportingSession, id);
        // The start reply is held until the session stops: sent without waiting for it.
        sd_bus_message* start = message(qv::dbus::kStartReportingSession);
        check(sd_bus_message_append_basic(start, 'x', &id), "append");
        check(sd_bus_call_async(bus_, nullptr, start, ignoreReply, nullptr, 600'000'000), "start");
        sd_bus_message_unref(start);
    }

    void endSession(std::int64_t id) {
        if (!endpoint_.hasSessions) {
            return;
        }
        call(qv::dbus::kStopReportingSession, id);
        call(qv::dbus::kDestroyReportingSession, id);
        while (sd_bus_process(bus_, nullptr) > 0) {
        }
    }

    // Sends count messages one call at a time; appends each call's latency in microseconds.
    void sendSerial(std::int64_t id, std::int64_t count, std::vector<double>& latencies) {
        for (std::int64_t i = 0; i < count; ++i) {
            sd_bus_message* m = makeSend(id, i);
            sd_bus_message* reply = nullptr;
            const auto t0 = Clock::now();
            if (sd_bus_call(bus_, m, kCallTimeoutMicros, nullptr, &reply) < 0) {
                ++errors_;
            }
            latencies.push_back(micros(Clock::now() - t0));
            sd_bus_message_unref(reply);
            sd_bus_message_unref(m);
        }
    }

    // Sends count messages keeping kPipelineDepth calls in flight.
    void sendPipelined(std::int64_t id, std::int64_t count, std::vector<double>& latencies) {
        Pipeline p{this, &latencies};
        std::int64_t sent = 0;
        std::vector<Clock::time_point> started(static_cast<std::size_t>(count));
        p.started = started.data();
        while (p.done < count) {
            while (p.inFlight < kPipelineDepth && sent < count) {
                sd_bus_message* m = makeSend(id, sent);
                started[static_cast<std::size_t>(sent)] = Clock::now();
                check(sd_bus_call_async(bus_, nullptr, m, onReply,
                                        new Call{&p, static_cast<std::size_t>(sent)},
                                        kCallTimeoutMicros),
                      "call");
                sd_bus_message_unref(m);
                ++sent;
                ++p.inFlight;
            }
            int r = 0;
            while ((r = sd_bus_process(bus_, nullptr)) > 0) {
            }
            check(r, "sd_bus_process");
            if (p.inFlight >= kPipelineDepth || sent == count) {
                sd_bus_wait(bus_, 100'000);
            }
        }
    }

    std::uint64_t errors() const { return errors_; }

  private:
    struct Pipeline {
        Client* client;
        std::vector<double>* latencies;
        Clock::time_point* started = nullptr;
        std::size_t inFlight = 0;
        std::int64_t done = 0;
    };
    struct Call {
        Pipeline* pipeline;
        std::size_t index;
    };

    static int onReply(sd_bus_message* reply, void* userdata, sd_bus_error*) {
        auto* call = static_cast<Call*>(userdata);
        Pipeline& p = *call->pipeline;
        if (sd_bus_message_is_method_error(reply, nullptr)) {
            ++p.client->errors_;
        }
        p.latencies->push_back(micros(Clock::now() - p.started[call->index]));
        --p.inFlight;
        ++p.done;
        delete call;
        return 1;
    }
    static int ignoreReply(sd_bus_message*, void*, sd_bus_error*) { return 1; }

    static double micros(Clock::duration d) {
        return std::chrono::duration<double, std::micro>(d).count();
    }

    sd_bus_message* message(const char* member) {
        sd_bus_message* m = nullptr;
        check(sd_bus_message_new_method_call(bus_, &m, endpoint_.destination, qv::dbus::kObjectPath,
                                             qv::dbus::kInterface, member),
              "new call");
        return m;
    }

    // The ten-key payload of a running output stream, as the PipeWire bridge sends it.
    sd_bus_message* makeSend(std::int64_t id, std::int64_t seq) {
        sd_bus_message* m = message(qv::dbus::kSendMessage);
        check(sd_bus_message_append(m, "a{sv}", 10, "session_selected_format", "s",
                                    "lpcm-48000-2ch-f32", "active_devices", "s", "Speaker",
                                    "KXSessionVolume", "d", 0.5, "session_output_running", "b", 1,
                                    "mChannelsPerFrame", "i", 2, "sequence", "x", seq, "route", "s",
                                    "BuiltInSpeaker", "latency_ms", "d", 11.6, "buffer_frames", "u",
                                    512u, "format", "a{sv}", 1, "rate", "i", 48000),
              "append payload");
        check(sd_bus_message_append(m, "uq", 4u, 1), "append");
        check(sd_bus_message_append_array(m, 'x', &id, sizeof id), "append ids");
        return m;
    }

    void call(const char* member, std::int64_t id) {
        sd_bus_message* m = message(member);
        check(sd_bus_message_append_basic(m, 'x', &id), "append");
        sd_bus_message* reply = nullptr;
        check(sd_bus_call(bus_, m, kCallTimeoutMicros, nullptr, &reply), member);
        sd_bus_message_unref(reply);
        sd_bus_message_unref(m);
    }

    Endpoint endpoint_;
    sd_bus* bus_ = nullptr;
    std::uint64_t errors_ = 0;
};

// CPU time (user and system) a process has used, in seconds.
double cpuSeconds(pid_t pid) {
    std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
    std::string text((std::istreambuf_iterator<char>(stat)), std::istreambuf_iterator<char>());
    // The command name (field 2) may hold spaces: fields are counted after its closing paren.
    const auto paren = text.rfind(')');
    if (paren == std::string::npos) {
        return 0;  // the process is gone
    }
    std::istringstream rest(text.substr(paren + 1));
    std::string field;
    double ticks = 0;
    for (int i = 3; i <= 15 && rest >> field; ++i) {
        if (i == 14 || i == 15) {
            ticks += std::stod(field);
        }
    }
    return ticks / static_cast<double>(sysconf(_SC_CLK_TCK));
}

struct Result {
    double messagesPerSecond = 0;
    double p99 = 0;
    // CPU time per message by process: the clients (this process), then each process of the path.
    std::vector<double> cpuMicrosByProcess;
    double cpuMicrosPerMessage() const {  // of the whole path
        return std::accumulate(cpuMicrosByProcess.begin(), cpuMicrosByProcess.end(), 0.0);
    }
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

// path: the processes the messages cross besides this one (the clients').
Result run(const Endpoint& endpoint, const std::vector<pid_t>& path, int clients, bool pipelined,
           std::int64_t perClient, std::int64_t firstID) {
    std::vector<std::vector<double>> latencies(static_cast<std::size_t>(clients));
    std::vector<std::unique_ptr<Client>> made;
    for (int c = 0; c < clients; ++c) {
        made.push_back(std::make_unique<Client>(endpoint));
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
    std::vector<pid_t> processes{getpid()};
    processes.insert(processes.end(), path.begin(), path.end());
    auto cpuByProcess = [&] {
        std::vector<double> seconds;
        for (pid_t pid : processes) {
            seconds.push_back(cpuSeconds(pid));
        }
        return seconds;
    };
    const std::vector<double> cpu0 = cpuByProcess();
    const auto t0 = Clock::now();
    go = true;
    for (auto& t : threads) {
        t.join();
    }
    const double seconds = std::chrono::duration<double>(Clock::now() - t0).count();
    const std::vector<double> cpu1 = cpuByProcess();
    Result r;
    std::vector<double> all;
    for (int c = 0; c < clients; ++c) {
        all.insert(all.end(), latencies[static_cast<std::size_t>(c)].begin(),
                   latencies[static_cast<std::size_t>(c)].end());
        r.errors += made[static_cast<std::size_t>(c)]->errors();
        made[static_cast<std::size_t>(c)]->endSession(firstID + c);
    }
    r.messagesPerSecond = static_cast<double>(all.size()) / seconds;
    for (std::size_t i = 0; i < processes.size(); ++i) {
        r.cpuMicrosByProcess.push_back(1e6 * (cpu1[i] - cpu0[i]) / static_cast<double>(all.size()));
    }
    r.p99 = percentile(all, 0.99);
    return r;
}

// Starts a program; returns its PID. With outFd, the child's stdout goes there.
pid_t spawn(const std::vector<std::string>& args, int outFd = -1) {
    const pid_t parent = getpid();
    const pid_t pid = fork();
    if (pid == 0) {
        // A ^C reaches the run alone, which then stops its programs in order; they still go
        // if the run is killed outright.
        setpgid(0, 0);
        prctl(PR_SET_PDEATHSIG, SIGTERM);
        if (getppid() != parent) {
            _exit(127);
        }
        sigset_t none;
        sigemptyset(&none);
        pthread_sigmask(SIG_SETMASK, &none, nullptr);
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

bool waitForName(const std::string& address, const char* name) {
    sd_bus* bus = nullptr;
    if (sd_bus_new(&bus) < 0 || sd_bus_set_address(bus, address.c_str()) < 0 ||
        sd_bus_set_bus_client(bus, 1) < 0 || sd_bus_start(bus) < 0) {
        sd_bus_unref(bus);
        return false;
    }
    bool has = false;
    for (int i = 0; i < 200 && !has; ++i) {
        sd_bus_message* reply = nullptr;
        int value = 0;
        if (sd_bus_call_method(bus, "org.freedesktop.DBus", "/org/freedesktop/DBus",
                               "org.freedesktop.DBus", "NameHasOwner", nullptr, &reply, "s",
                               name) >= 0 &&
            sd_bus_message_read(reply, "b", &value) > 0) {
            has = value != 0;
        }
        sd_bus_message_unref(reply);
        if (!has) {
            std::this_thread::sleep_for(std::chrono::milliseconds(50));
        }
    }
    sd_bus_flush_close_unref(bus);
    return has;
}

// Reads every value of the container the message stands in, as a server must to use them.
int readAll(sd_bus_message* m) {
    for (;;) {
        char type = 0;
        const char* contents = nullptr;
        int r = sd_bus_message_peek_type(m, &type, &contents);
        if (r <= 0) {
            return r;
        }
        if (type == 'a' || type == 'v' || type == 'r' || type == 'e') {
            if ((r = sd_bus_message_enter_container(m, type, contents)) < 0 ||
                (r = readAll(m)) < 0 || (r = sd_bus_message_exit_container(m)) < 0) {
                return r;
            }
            continue;
        }
        union {
            std::uint64_t number;
            double real;
            const char* text;
        } value{};
        if ((r = sd_bus_message_read_basic(m, type, &value)) < 0) {
            return r;
        }
    }
}

int onTrivialSend(sd_bus_message* call, void*, sd_bus_error*) {
    const int r = readAll(call);
    return r < 0 ? r : sd_bus_reply_method_return(call, "");
}

const sd_bus_vtable kTrivialVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("SendMessage", "a{sv}uqax", "", onTrivialSend, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END};

int trivialServer(const std::string& address) {
    sd_bus* bus = nullptr;
    check(sd_bus_new(&bus), "sd_bus_new");
    check(sd_bus_set_address(bus, address.c_str()), "address");
    check(sd_bus_set_bus_client(bus, 1), "bus client");
    check(sd_bus_start(bus), "start");
    check(sd_bus_add_object_vtable(bus, nullptr, qv::dbus::kObjectPath, qv::dbus::kInterface,
                                   kTrivialVtable, nullptr),
          "vtable");
    check(sd_bus_request_name(bus, kTrivialName, 0), "name");
    for (;;) {
        const int r = sd_bus_process(bus, nullptr);
        check(r, "process");
        if (r == 0) {
            check(sd_bus_wait(bus, UINT64_MAX), "wait");
        }
    }
}

// What a run started, stopped and cleared away however the run ends: at its end, when the
// daemon does not come up, or on ^C or SIGTERM (else the daemon's store stays behind in /tmp).
struct Started {
    std::mutex mutex;
    bool ended = false;  // guarded by mutex
    std::atomic<pid_t> bus{0};
    std::atomic<pid_t> qv{0};
    std::atomic<pid_t> trivial{0};
    std::filesystem::path stateDir;  // set before any signal is taken

    void end() {
        std::lock_guard lock(mutex);
        if (std::exchange(ended, true)) {
            return;
        }
        const pid_t servers[] = {trivial.load(), qv.load()};
        for (const pid_t pid : servers) {
            if (pid > 0) {
                kill(pid, SIGTERM);
            }
        }
        for (const pid_t pid : servers) {
            if (pid > 0) {
                waitpid(pid, nullptr, 0);
            }
        }
        if (bus > 0) {
            kill(bus, SIGTERM);
            waitpid(bus, nullptr, 0);
        }
        std::error_code ignored;
        std::filesystem::remove_all(stateDir, ignored);
    }
};

}  // namespace

int main(int argc, char** argv) {
    std::string daemon;
    std::int64_t total = 200000;
    bool memoryOnly = false;
    bool throughputOnly = false;
    bool cpuSplit = false;
    bool direct = true;
    std::vector<int> clientCounts{1, 4, 16};
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
        } else if (a == "--throughput-only") {
            throughputOnly = true;
        } else if (a == "--cpu-split") {
            cpuSplit = true;
        } else if (a == "--no-direct") {
            direct = false;
        } else if (a == "--clients" && i + 1 < argc) {
            clientCounts = {std::stoi(argv[++i])};
        } else {
            std::fprintf(stderr,
                         "usage: %s --daemon PATH/qvreportd [--messages N] [--memory-only | "
                         "--throughput-only] [--cpu-split] [--no-direct] [--clients N]\n"
                         "  N: messages per pipelined workload (default 200000; serial ones "
                         "send a tenth)\n"
                         "  --memory-only: only the memory check, not the throughput table\n"
                         "  --throughput-only: only the throughput table, not the memory check\n"
                         "  --cpu-split: under each row, the CPU per message of each process\n"
                         "  --no-direct: the bus only (a daemon without a direct socket)\n"
                         "  --clients N: only the rows of N clients (default 1, 4 and 16)\n",
                         argv[0]);
            return 2;
        }
    }
    if (daemon.empty()) {
        std::fprintf(stderr, "--daemon PATH/qvreportd is required (see --help)\n");
        return 2;
    }
    if (memoryOnly && throughputOnly) {
        std::fprintf(stderr, "--memory-only and --throughput-only leave nothing to run\n");
        return 2;
    }
    signal(SIGPIPE, SIG_IGN);
    std::setvbuf(stdout, nullptr, _IOLBF, 0);  // rows appear as they are measured

    static Started started;
    started.stateDir =
        std::filesystem::temp_directory_path() / ("qv-load-" + std::to_string(getpid()));
    // Every thread of the run holds these signals; one waits for them and ends the run cleanly.
    sigset_t stops;
    sigemptyset(&stops);
    for (const int sig : {SIGINT, SIGTERM, SIGHUP}) {
        sigaddset(&stops, sig);
    }
    pthread_sigmask(SIG_BLOCK, &stops, nullptr);
    std::thread([stops] {
        int sig = 0;
        sigwait(&stops, &sig);
        started.end();
        _exit(128 + sig);
    }).detach();

    int pipeFds[2];
    if (pipe(pipeFds) != 0) {
        return 1;
    }
    const pid_t bus =
        spawn({"dbus-daemon", "--session", "--nofork", "--print-address=1"}, pipeFds[1]);
    started.bus = bus;
    close(pipeFds[1]);
    char buf[512] = {};
    const auto n = read(pipeFds[0], buf, sizeof buf - 1);
    std::string address(buf, n > 0 ? static_cast<std::size_t>(n) : 0);
    address.erase(address.find_last_not_of("\n") + 1);

    const auto& stateDir = started.stateDir;
    std::filesystem::create_directories(stateDir);
    const std::string socket = (stateDir / "direct").string();
    std::vector<std::string> daemonArgs{
        daemon, "--bus", address, "--state-dir", stateDir.string(), "--log-level", "error"};
    if (direct) {
        daemonArgs.insert(daemonArgs.end(), {"--direct-socket", socket});
    }
    const pid_t qv = spawn(daemonArgs);
    started.qv = qv;
    const pid_t trivial = spawn({argv[0], "--trivial-server", address});
    started.trivial = trivial;
    if (!waitForName(address, qv::dbus::kBusName) || !waitForName(address, kTrivialName)) {
        std::fprintf(stderr, "the daemon or the trivial server did not come up\n");
        started.end();
        return 1;
    }

    const Endpoint trivialEndpoint{address, kTrivialName, false};
    const Endpoint busEndpoint{address, qv::dbus::kBusName, true};
    const Endpoint directEndpoint{"unix:path=" + socket, nullptr, true};
    std::printf("%-7s %-9s | %9s %8s | %9s %8s %6s | %9s %8s %6s | %9s %9s\n", "clients", "mode",
                "trivial/s", "p99 us", "bus/s", "p99 us", "/triv", "direct/s", "p99 us", "/bus",
                "cpu us/m", "cpu us/m");
    std::printf("%-7s %-9s | %18s | %25s | %25s | %9s %9s\n", "", "", "(plain sd-bus server)",
                "(daemon over the bus)", "(daemon, direct socket)", "bus", "direct");
    std::int64_t nextID = 1000;
    bool busMet = true, directMet = true;
    for (int clients : clientCounts) {
        for (bool pipelined : {false, true}) {
            if (memoryOnly) {
                break;
            }
            const std::int64_t perClient = (pipelined ? total : total / 10) / clients;
            const Result t =
                run(trivialEndpoint, {bus, trivial}, clients, pipelined, perClient, nextID);
            const Result b = run(busEndpoint, {bus, qv}, clients, pipelined, perClient, nextID);
            nextID += clients;
            Result d;
            if (direct) {
                d = run(directEndpoint, {qv}, clients, pipelined, perClient, nextID);
                nextID += clients;
            }
            const double busRatio = b.messagesPerSecond / t.messagesPerSecond;
            const double directRatio = d.messagesPerSecond / b.messagesPerSecond;
            std::printf(
                "%-7d %-9s | %9.0f %8.0f | %9.0f %8.0f %6.2f | %9.0f %8.0f %6.2f | %8.1f %8.1f "
                "%9.1f%s\n",
                clients, pipelined ? "pipelined" : "serial", t.messagesPerSecond, t.p99,
                b.messagesPerSecond, b.p99, busRatio, d.messagesPerSecond, d.p99, directRatio,
                t.cpuMicrosPerMessage(), b.cpuMicrosPerMessage(), d.cpuMicrosPerMessage(),
                t.errors + b.errors + d.errors ? "  (errors!)" : "");
            if (cpuSplit) {
                auto split = [](const char* name, const Result& r, const char* server) {
                    if (r.cpuMicrosByProcess.empty()) {
                        return;
                    }
                    const auto& c = r.cpuMicrosByProcess;
                    std::printf("  %s: clients %.1f", name, c[0]);
                    if (c.size() == 3) {
                        std::printf(", broker %.1f", c[1]);
                    }
                    std::printf(", %s %.1f", server, c.back());
                };
                std::printf("%-17s |", "  cpu us/msg");
                split("trivial", t, "server");
                split("| bus", b, "daemon");
                split("| direct", d, "daemon");
                std::printf("\n");
            }
            if (pipelined && (busRatio < 0.8 || b.p99 > 2 * t.p99)) {
                busMet = false;
            }
            if (direct && pipelined && (directRatio < 1.5 || d.p99 > b.p99)) {
                directMet = false;
            }
        }
    }

    // Memory: 10^6 messages through sessions that are stopped and destroyed. The daemon hands
    // freed memory back to the system on a timer of 5 s: both readings wait a little longer.
    const auto settledRss = [qv] {
        std::this_thread::sleep_for(std::chrono::seconds(6));
        return rssKiB(qv);
    };
    std::optional<bool> memoryMet;
    if (!throughputOnly) {
        const int clients = 16;
        const std::int64_t perSession = 10000;
        const std::int64_t rounds = 1000000 / (clients * perSession);
        // One round first, so that "before" is a daemon that has served sessions (its thread
        // arenas, worker registry and sink buffers exist), not one that has never been used.
        const long untouched = rssKiB(qv);
        run(busEndpoint, {}, clients, true, perSession, nextID);
        nextID += clients;
        const long before = settledRss();
        for (std::int64_t r = 0; r < rounds; ++r) {
            run(busEndpoint, {}, clients, true, perSession, nextID);
            nextID += clients;
        }
        const long atOnce = rssKiB(qv);
        const long after = settledRss();
        std::printf(
            "\nRSS %ld KiB when the memory check began, %ld KiB after one round (before); after "
            "%lld messages in stopped sessions %ld KiB at once, %ld KiB settled (%+.1f%%)\n",
            untouched, before, static_cast<long long>(rounds * clients * perSession), atOnce, after,
            100.0 * static_cast<double>(after - before) / static_cast<double>(before));
        memoryMet = after <= before * 11 / 10;
    }
    const char* memoryVerdict = !memoryMet ? "not measured" : *memoryMet ? "met" : "NOT met";
    if (memoryOnly) {
        std::printf("target (RSS within 10%%): %s\n", memoryVerdict);
    } else {
        std::printf(
            "targets: over the bus, pipelined >= 0.8x the trivial server's msg/s with p99 <= 2x "
            "its p99: %s; direct, pipelined >= 1.5x the bus's msg/s with p99 no worse: %s; RSS "
            "within 10%%: %s\n",
            busMet ? "met" : "NOT met",
            !direct     ? "not measured"
            : directMet ? "met"
                        : "NOT met",
            memoryVerdict);
    }

    started.end();
    return 0;
}
