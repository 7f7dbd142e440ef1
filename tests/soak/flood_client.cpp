// A client that floods the daemon the ways an unprivileged local user could, for the soak's flood
// scenarios (tests/soak/floods.py), and a probe that measures what another client meanwhile
// waits. Written on sd-bus itself: it must send tens of thousands of calls without waiting for
// any answer, which a blocking binding cannot.
//
//   qv_flood_client --address ADDR MODE [--count N] [--bytes N] [--first-id ID] [--seconds S]
//
// Modes:
//   sessions  creates and starts N sessions (IDs from --first-id), every call in flight at once;
//             prints "sessions N seconds S" once a final call, queued behind them all, answers
//   held      starts one session, then sends N more starts of it without expecting replies
//             (by the rules never answered); prints "held N" once a final call answers
//   sends     sends N messages of --bytes of text each to one started session (every payload
//             different) and never reads the answers; prints "sent N" when all are written, then
//             waits to be killed
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
#include <string>
#include <vector>

#include <systemd/sd-bus.h>

#include "QVReportingDBusNames.h"

namespace {

using namespace qv::dbus;

struct Options {
    std::string address;
    std::string mode;
    long count = 1000;
    long bytes = 600 * 1024;
    std::int64_t firstID = 1;
    double seconds = 5;
};

[[noreturn]] void die(const char* what, int r) {
    std::fprintf(stderr, "flood: %s: %s\n", what, std::strerror(-r));
    std::exit(1);
}

double now() {
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
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

// A call answered after everything the client sent before it (the daemon serves one client's
// calls in order): its answer means the daemon has taken in all of them.
void barrier(sd_bus* bus) {
    sd_bus_error error = SD_BUS_ERROR_NULL;
    sd_bus_message* reply = nullptr;
    const int r =
        sd_bus_call(bus, idCall(bus, kReporterIDValid, 0), 600 * 1000000ull, &error, &reply);
    if (r < 0) {
        std::fprintf(stderr, "flood: final call: %s\n", error.message ? error.message : "");
        std::exit(1);
    }
    sd_bus_message_unref(reply);
    sd_bus_error_free(&error);
}

void flush(sd_bus* bus) {
    const int r = sd_bus_flush(bus);
    if (r < 0)
        die("flush", r);
}

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
            r = sd_bus_message_append(m, "uq", 4u, std::uint16_t{1});
        if (r >= 0)
            r = sd_bus_message_append(m, "ax", 1, o.firstID);
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
    for (int i = 1; i < argc; ++i) {
        const std::string a = argv[i];
        auto next = [&] {
            if (i + 1 >= argc) {
                std::fprintf(stderr, "flood: %s needs a value\n", a.c_str());
                std::exit(2);
            }
            return std::string(argv[++i]);
        };
        if (a == "--address")
            o.address = next();
        else if (a == "--count")
            o.count = std::stol(next());
        else if (a == "--bytes")
            o.bytes = std::stol(next());
        else if (a == "--first-id")
            o.firstID = std::stoll(next());
        else if (a == "--seconds")
            o.seconds = std::stod(next());
        else if (a == "--help") {
            std::puts(
                "usage: qv_flood_client --address ADDR sessions|held|sends|probe [--count N] "
                "[--bytes N] [--first-id ID] [--seconds S]");
            return 0;
        } else
            o.mode = a;
    }
    if (o.address.empty()) {
        std::fprintf(stderr, "flood: --address is required\n");
        return 2;
    }
    if (o.mode == "sessions")
        return sessions(o);
    if (o.mode == "held")
        return held(o);
    if (o.mode == "sends")
        return sends(o);
    if (o.mode == "probe")
        return probe(o);
    std::fprintf(stderr, "flood: unknown mode '%s'\n", o.mode.c_str());
    return 2;
}
