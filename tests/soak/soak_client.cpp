// The fault soak's client (tests/soak/soak.py, floods.py), on sd-bus itself: it must keep many
// calls in flight, or send tens of thousands without waiting for any answer, which a blocking
// binding cannot, and cost the machine little beside the daemon.
//
//   qv_soak_client --address ADDR [MODE] [--first-id ID] [--sessions N] [--messages N]
//                  [--depth N] [--padding BYTES] [--progress N] [--answers FILE]
//                  [--keep-sessions] [--count N] [--bytes N] [--seconds S]
//
// Modes:
//   load      (the default) creates --sessions sessions, configured with
//             "HostApplicationDisplayID" "soak.<ID>", starts them (the start replies stay held),
//             sends --messages messages round robin, --depth calls in flight, each carrying
//             "soak_rid" and "soak_seq" (its number within its session), then stops and destroys
//             the sessions (--keep-sessions: leaves them running and waits to be killed). Prints
//             "started" once every session runs, "progress N" every --progress answered calls,
//             then "done answered=N errors=N gone=0|1"; --answers FILE gets "RID SEQ MONOTONIC_NS"
//             per call answered without error. When the daemon leaves the bus mid-way (calls
//             answered with errors), it stops sending, lets the calls in flight end, writes what
//             it has and exits 0.
//   sessions  creates and starts --count sessions, every call in flight at once; prints
//             "sessions N seconds S" once a final call, queued behind them all, answers
//   held      starts one session, then sends --count more starts of it without expecting replies
//             (by the rules never answered); prints "held N" once a final call answers
//   sends     sends --count messages of --bytes of text each to one started session (every
//             payload different) and never reads the answers; prints "sent N" when all are
//             written, then waits to be killed
//   probe     calls ReporterIDValid, then the bus's own GetId, every 10 ms for --seconds; prints
//             "probe calls=N refused=N daemon p50_ms=X p99_ms=X max_ms=X; bus itself ..."
#include <poll.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <map>
#include <string>
#include <vector>

#include <systemd/sd-bus.h>

#include "QVReportingDBusNames.h"

namespace {

using namespace qv::dbus;

struct Options {
    std::string address;
    std::string mode = "load";
    std::int64_t firstID = 1;
    long sessions = 1;
    long messages = 1000;  // in all, spread over the sessions
    std::size_t depth = 32;
    std::size_t padding = 0;
    long progressEvery = 500;
    std::string answersFile;
    bool keepSessions = false;
    long count = 1000;
    long bytes = 600 * 1024;
    double seconds = 5;
};

[[noreturn]] void die(const char* what, int r) {
    std::fprintf(stderr, "soak client: %s: %s\n", what, std::strerror(-r));
    std::exit(1);
}

std::int64_t nanos() {
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<std::int64_t>(ts.tv_sec) * 1000000000 + ts.tv_nsec;
}

double now() {
    return static_cast<double>(nanos()) / 1e9;
}

sd_bus* connect(const std::string& address) {
    sd_bus* bus = nullptr;
    int r = sd_bus_new(&bus);
    if (r >= 0)
        r = sd_bus_set_address(bus, address.c_str());
    if (r >= 0)
        r = sd_bus_set_bus_client(bus, 1);
    if (r >= 0)
        r = sd_bus_start(bus);
    if (r < 0)
        die("connect", r);
    return bus;
}

sd_bus_message* newCall(sd_bus* bus, const char* member) {
    sd_bus_message* m = nullptr;
    const int r =
        sd_bus_message_new_method_call(bus, &m, kBusName, kObjectPath, kInterface, member);
    if (r < 0)
        die("new call", r);
    return m;
}

// Sends a call whose reply is not waited for; expectReply false marks it as wanting none.
void sendCall(sd_bus* bus, sd_bus_message* m, bool expectReply) {
    if (!expectReply)
        sd_bus_message_set_expect_reply(m, 0);
    const int r = sd_bus_send(bus, m, nullptr);
    sd_bus_message_unref(m);
    if (r < 0)
        die("send", r);
}

sd_bus_message* idCall(sd_bus* bus, const char* member, std::int64_t id) {
    sd_bus_message* m = newCall(bus, member);
    const int r = sd_bus_message_append(m, "x", id);
    if (r < 0)
        die("append", r);
    return m;
}

// Waits for the call's answer; an error ends the client.
void callOrDie(sd_bus* bus, sd_bus_message* m) {
    sd_bus_error error = SD_BUS_ERROR_NULL;
    sd_bus_message* reply = nullptr;
    if (sd_bus_call(bus, m, 600 * 1000000ull, &error, &reply) < 0) {
        std::fprintf(stderr, "soak client: %s: %s: %s\n", sd_bus_message_get_member(m),
                     error.name ? error.name : "", error.message ? error.message : "");
        std::exit(1);
    }
    sd_bus_message_unref(m);
    sd_bus_message_unref(reply);
}

// A call answered after everything the client sent before it (the daemon serves one client's
// calls in order): its answer means the daemon has taken in all of them.
void barrier(sd_bus* bus) {
    callOrDie(bus, idCall(bus, kReporterIDValid, 0));
}

void flush(sd_bus* bus) {
    const int r = sd_bus_flush(bus);
    if (r < 0)
        die("flush", r);
}

// Dispatches what has arrived; with wait, first waits up to 100 ms for something to.
void pump(sd_bus* bus, bool wait) {
    int r = 0;
    while ((r = sd_bus_process(bus, nullptr)) > 0) {
    }
    if (r >= 0 && wait && (r = sd_bus_wait(bus, 100000)) >= 0) {
        while ((r = sd_bus_process(bus, nullptr)) > 0) {
        }
    }
    if (r < 0)
        die("process", r);
}

class LoadClient {
  public:
    explicit LoadClient(const Options& options)
        : o_(options),
          bus_(connect(options.address)),
          padding_(options.padding, 'p'),
          nextSeq_(static_cast<std::size_t>(options.sessions), 0) {}

    int run() {
        for (long s = 0; s < o_.sessions; ++s) {
            const std::int64_t rid = o_.firstID + s;
            callOrDie(bus_, idCall(bus_, kCreateReportingSession, rid));
            sd_bus_message* configure = newCall(bus_, kSetConfiguration);
            const std::string app = "soak." + std::to_string(rid);
            if (const int r = sd_bus_message_append(
                    configure, "a{sv}x", 1, "HostApplicationDisplayID", "s", app.c_str(), rid);
                r < 0)
                die("append", r);
            callOrDie(bus_, configure);
            // Answered only when the session stops. Without a callback sd-bus would mark the
            // call as wanting no reply.
            sd_bus_message* start = idCall(bus_, kStartReportingSession, rid);
            auto ignore = [](sd_bus_message*, void*, sd_bus_error*) { return 0; };
            if (const int r =
                    sd_bus_call_async(bus_, nullptr, start, ignore, nullptr, 3600 * 1000000ull);
                r < 0)
                die("start", r);
            sd_bus_message_unref(start);
        }
        // Calls of one connection are handled in order: once this is answered, every start ran.
        callOrDie(bus_, newCall(bus_, kGetAllReporters));
        std::printf("started\n");
        std::fflush(stdout);

        long sent = 0;
        while (!gone_ && (sent < o_.messages || inFlight_ > 0)) {
            while (!gone_ && inFlight_ < o_.depth && sent < o_.messages) {
                send(static_cast<std::size_t>(sent % o_.sessions));
                ++sent;
            }
            pump(bus_, true);
        }
        // The daemon is gone: the calls still out end with errors from the bus.
        while (inFlight_ > 0)
            pump(bus_, true);
        writeAnswers();
        if (!gone_ && !o_.keepSessions) {
            for (long s = 0; s < o_.sessions; ++s) {
                callOrDie(bus_, idCall(bus_, kStopReportingSession, o_.firstID + s));
                callOrDie(bus_, idCall(bus_, kDestroyReportingSession, o_.firstID + s));
            }
            pump(bus_, false);
        }
        std::printf("done answered=%zu errors=%ld gone=%d\n", answers_.size(), errors_,
                    gone_ ? 1 : 0);
        std::fflush(stdout);
        while (o_.keepSessions)
            pump(bus_, true);
        return 0;
    }

  private:
    struct Call {
        LoadClient* client;
        std::int64_t rid;
        std::int64_t seq;
    };
    struct Answer {
        std::int64_t rid;
        std::int64_t seq;
        std::int64_t nanos;
    };

    void send(std::size_t session) {
        const std::int64_t rid = o_.firstID + static_cast<std::int64_t>(session);
        const std::int64_t seq = nextSeq_[session]++;
        sd_bus_message* m = newCall(bus_, kSendMessage);
        // Playback/Start (category 4, type 1), addressed to this session alone.
        int r = sd_bus_message_append(m, "a{sv}", padding_.empty() ? 5 : 6, "soak_rid", "x", rid,
                                      "soak_seq", "x", seq, "session_output_running", "b", 1,
                                      "route", "s", "BuiltInSpeaker", "latency_ms", "d", 11.6,
                                      "padding", "s", padding_.c_str());
        if (r >= 0)
            r = sd_bus_message_append(m, "uqax", 4u, std::uint16_t{1}, 1, rid);
        if (r >= 0)
            r = sd_bus_call_async(bus_, nullptr, m, &LoadClient::answered, new Call{this, rid, seq},
                                  120 * 1000000ull);
        sd_bus_message_unref(m);
        if (r < 0)
            die("send", r);
        ++inFlight_;
    }

    static int answered(sd_bus_message* reply, void* data, sd_bus_error*) {
        const Call call = *static_cast<Call*>(data);
        delete static_cast<Call*>(data);
        LoadClient& c = *call.client;
        --c.inFlight_;
        if (sd_bus_message_is_method_error(reply, nullptr)) {
            ++c.errors_;
            // Anything but a refusal of this one call means the daemon went away.
            const char* name = sd_bus_message_get_error(reply)->name;
            if (std::strcmp(name, kErrorLimitsExceeded) != 0 &&
                std::strcmp(name, kErrorInvalidArgs) != 0)
                c.gone_ = true;
            return 0;
        }
        c.answers_.push_back(Answer{call.rid, call.seq, nanos()});
        if (static_cast<long>(c.answers_.size()) % c.o_.progressEvery == 0) {
            std::printf("progress %zu\n", c.answers_.size());
            std::fflush(stdout);
        }
        return 0;
    }

    void writeAnswers() const {
        if (o_.answersFile.empty())
            return;
        std::FILE* f = std::fopen(o_.answersFile.c_str(), "w");
        if (!f) {
            std::perror(o_.answersFile.c_str());
            return;
        }
        for (const Answer& a : answers_) {
            std::fprintf(f, "%lld %lld %lld\n", static_cast<long long>(a.rid),
                         static_cast<long long>(a.seq), static_cast<long long>(a.nanos));
        }
        std::fclose(f);
    }

    const Options o_;
    sd_bus* bus_;
    const std::string padding_;
    std::vector<std::int64_t> nextSeq_;
    std::vector<Answer> answers_;
    std::size_t inFlight_ = 0;
    long errors_ = 0;
    bool gone_ = false;
};

int sessions(const Options& o) {
    sd_bus* bus = connect(o.address);
    const double begin = now();
    for (long i = 0; i < o.count; ++i) {
        // Answers are read by the final call's wait and dropped.
        sendCall(bus, idCall(bus, kCreateReportingSession, o.firstID + i), true);
        sendCall(bus, idCall(bus, kStartReportingSession, o.firstID + i), true);
    }
    barrier(bus);
    std::printf("sessions %ld seconds %.3f\n", o.count, now() - begin);
    std::fflush(stdout);
    pause();  // the sessions live as long as the connection
    return 0;
}

int held(const Options& o) {
    sd_bus* bus = connect(o.address);
    sendCall(bus, idCall(bus, kCreateReportingSession, o.firstID), false);
    sendCall(bus, idCall(bus, kStartReportingSession, o.firstID), false);
    for (long i = 0; i < o.count; ++i) {
        sendCall(bus, idCall(bus, kStartReportingSession, o.firstID), false);
        if (i % 1024 == 0)
            flush(bus);
    }
    barrier(bus);
    std::printf("held %ld\n", o.count);
    std::fflush(stdout);
    pause();
    return 0;
}

int sends(const Options& o) {
    sd_bus* bus = connect(o.address);
    sendCall(bus, idCall(bus, kCreateReportingSession, o.firstID), false);
    sendCall(bus, idCall(bus, kStartReportingSession, o.firstID), false);
    std::string text(static_cast<std::size_t>(o.bytes), 'x');
    for (long i = 0; i < o.count; ++i) {
        std::snprintf(text.data(), 20, "%019ld", i);  // every payload different
        text[19] = 'x';
        sd_bus_message* m = newCall(bus, kSendMessage);
        int r = sd_bus_message_append(m, "a{sv}", 1, "blob", "s", text.c_str());
        if (r >= 0)
            r = sd_bus_message_append(m, "uqax", 4u, std::uint16_t{1}, 1, o.firstID);
        if (r < 0)
            die("append", r);
        sendCall(bus, m, true);  // a reply is expected and never read
    }
    flush(bus);
    std::printf("sent %ld\n", o.count);
    std::fflush(stdout);
    pause();
    return 0;
}

// Times one call and waits until it is answered; false when it was answered with an error.
bool timedCall(sd_bus* bus, sd_bus_message* m, std::vector<double>& waits) {
    sd_bus_error error = SD_BUS_ERROR_NULL;
    sd_bus_message* reply = nullptr;
    const double t = now();
    const int r = sd_bus_call(bus, m, 120 * 1000000ull, &error, &reply);
    waits.push_back((now() - t) * 1000);
    sd_bus_message_unref(m);
    sd_bus_message_unref(reply);
    sd_bus_error_free(&error);
    return r >= 0;
}

std::string percentiles(std::vector<double> waits) {
    std::sort(waits.begin(), waits.end());
    auto at = [&](double q) {
        return waits.empty() ? 0.0 : waits[static_cast<std::size_t>(q * (waits.size() - 1))];
    };
    char text[128];
    std::snprintf(text, sizeof text, "p50_ms=%.2f p99_ms=%.2f max_ms=%.2f", at(0.5), at(0.99),
                  waits.empty() ? 0.0 : waits.back());
    return text;
}

// Alternates a call to the daemon with one to the bus itself (GetId, answered by the broker): the
// second is the baseline, what any client of this bus waits whatever the daemon does.
int probe(const Options& o) {
    sd_bus* bus = connect(o.address);
    std::vector<double> daemonWaits, brokerWaits;
    long refused = 0;
    const double end = now() + o.seconds;
    while (now() < end) {
        refused += timedCall(bus, idCall(bus, kReporterIDValid, 1), daemonWaits) ? 0 : 1;
        sd_bus_message* getId = nullptr;
        if (const int r = sd_bus_message_new_method_call(bus, &getId, "org.freedesktop.DBus",
                                                         "/org/freedesktop/DBus",
                                                         "org.freedesktop.DBus", "GetId");
            r < 0) {
            die("new call", r);
        }
        timedCall(bus, getId, brokerWaits);
        usleep(10000);
    }
    std::printf("probe calls=%zu refused=%ld daemon %s; bus itself %s\n", daemonWaits.size(),
                refused, percentiles(daemonWaits).c_str(), percentiles(brokerWaits).c_str());
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    Options o;
    const std::map<std::string, std::function<void(const std::string&)>> set{
        {"--address", [&](const std::string& v) { o.address = v; }},
        {"--first-id", [&](const std::string& v) { o.firstID = std::stoll(v); }},
        {"--sessions", [&](const std::string& v) { o.sessions = std::stol(v); }},
        {"--messages", [&](const std::string& v) { o.messages = std::stol(v); }},
        {"--depth", [&](const std::string& v) { o.depth = std::stoul(v); }},
        {"--padding", [&](const std::string& v) { o.padding = std::stoul(v); }},
        {"--progress", [&](const std::string& v) { o.progressEvery = std::stol(v); }},
        {"--answers", [&](const std::string& v) { o.answersFile = v; }},
        {"--count", [&](const std::string& v) { o.count = std::stol(v); }},
        {"--bytes", [&](const std::string& v) { o.bytes = std::stol(v); }},
        {"--seconds", [&](const std::string& v) { o.seconds = std::stod(v); }},
    };
    for (int i = 1; i < argc; ++i) {
        const std::string a = argv[i];
        if (a == "--keep-sessions") {
            o.keepSessions = true;
        } else if (a.rfind("--", 0) != 0) {
            o.mode = a;
        } else if (set.count(a) && i + 1 < argc) {
            set.at(a)(argv[++i]);
        } else {
            std::fprintf(stderr, "soak client: unknown option %s, or no value\n", a.c_str());
            return 2;
        }
    }
    if (o.address.empty() || o.sessions <= 0 || o.depth == 0 || o.progressEvery <= 0) {
        std::fprintf(stderr, "soak client: --address is required, and counts must be positive\n");
        return 2;
    }
    const std::map<std::string, std::function<int(const Options&)>> modes{
        {"load", [](const Options& options) { return LoadClient(options).run(); }},
        {"sessions", sessions},
        {"held", held},
        {"sends", sends},
        {"probe", probe}};
    if (!modes.count(o.mode)) {
        std::fprintf(stderr, "soak client: unknown mode '%s'\n", o.mode.c_str());
        return 2;
    }
    return modes.at(o.mode)(o);
}
