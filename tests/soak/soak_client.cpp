// One client of the fault soak (tests/soak/soak.py): a bus connection that creates its sessions,
// starts them (the start replies stay held until the sessions stop), sends its messages with many
// calls in flight, then stops and destroys its sessions. A python client cannot keep dozens of
// these busy on two cores; this one costs the machine little beside the daemon.
//
//   qv_soak_client --address ADDR --first-id ID [--sessions N] [--messages N] [--depth N]
//                  [--padding BYTES] [--progress N] [--answers FILE] [--keep-sessions]
//
// Every message goes to one session (round robin) and carries "soak_rid" and "soak_seq" (its
// number within that session), so the sink's lines can be matched to the calls. Each session is
// configured with "HostApplicationDisplayID" "soak.<ID>", which the daemon stamps into every
// message and into the session's summary.
//
// On stdout, one line each: "started" once every session runs, "progress N" every 500 answered
// calls (--progress N), then "done answered=N errors=N gone=0|1". --answers FILE gets one line per
// call answered without error, "RID SEQ MONOTONIC_NS" (the time the answer arrived,
// CLOCK_MONOTONIC), written when the client ends; --keep-sessions leaves the sessions running at
// the end and waits to be killed. When the daemon leaves the bus mid-way (calls answered with
// errors), the client stops sending, lets the calls in flight end, writes what it has and exits 0.
#include <poll.h>
#include <time.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <sdbus-c++/sdbus-c++.h>

#include "QVReportingDBusNames.h"

namespace {

using Payload = std::map<std::string, sdbus::Variant>;

struct Options {
    std::string address;
    std::int64_t firstID = 0;
    int sessions = 1;
    std::int64_t messages = 1000;  // in all, spread over the sessions
    std::size_t depth = 32;
    std::size_t padding = 0;
    std::int64_t progressEvery = 500;
    std::string answersFile;
    bool keepSessions = false;
};

struct Answer {
    std::int64_t rid;
    std::int64_t seq;
    std::int64_t nanos;
};

std::int64_t monotonicNanos() {
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<std::int64_t>(ts.tv_sec) * 1000000000 + ts.tv_nsec;
}

bool parse(int argc, char** argv, Options& o) {
    for (int i = 1; i < argc; ++i) {
        const std::string a = argv[i];
        const bool hasValue = i + 1 < argc;
        if (a == "--address" && hasValue) {
            o.address = argv[++i];
        } else if (a == "--first-id" && hasValue) {
            o.firstID = std::atoll(argv[++i]);
        } else if (a == "--sessions" && hasValue) {
            o.sessions = std::atoi(argv[++i]);
        } else if (a == "--messages" && hasValue) {
            o.messages = std::atoll(argv[++i]);
        } else if (a == "--depth" && hasValue) {
            o.depth = static_cast<std::size_t>(std::atoll(argv[++i]));
        } else if (a == "--padding" && hasValue) {
            o.padding = static_cast<std::size_t>(std::atoll(argv[++i]));
        } else if (a == "--progress" && hasValue) {
            o.progressEvery = std::atoll(argv[++i]);
        } else if (a == "--answers" && hasValue) {
            o.answersFile = argv[++i];
        } else if (a == "--keep-sessions") {
            o.keepSessions = true;
        } else {
            return false;
        }
    }
    return !o.address.empty() && o.firstID > 0 && o.sessions > 0 && o.messages >= 0 &&
           o.depth > 0 && o.progressEvery > 0;
}

class SoakClient {
  public:
    explicit SoakClient(const Options& options)
        : options_(options),
          connection_(sdbus::createSessionBusConnectionWithAddress(options.address)),
          proxy_(sdbus::createProxy(*connection_, qv::dbus::kBusName, qv::dbus::kObjectPath)),
          padding_(options.padding, 'p'),
          nextSeq_(static_cast<std::size_t>(options.sessions), 0) {
        answers_.reserve(static_cast<std::size_t>(options.messages));
    }

    void beginSessions() {
        for (int s = 0; s < options_.sessions; ++s) {
            const std::int64_t rid = options_.firstID + s;
            callBool(qv::dbus::kCreateReportingSession, rid);
            auto configure =
                proxy_->createMethodCall(qv::dbus::kInterface, qv::dbus::kSetConfiguration);
            configure << Payload{{"HostApplicationDisplayID",
                                  sdbus::Variant("soak." + std::to_string(rid))}}
                      << rid;
            proxy_->callMethod(configure);
            auto start =
                proxy_->createMethodCall(qv::dbus::kInterface, qv::dbus::kStartReportingSession);
            start << rid;
            // Answered only when the session stops; the handle keeps the callback alive.
            heldStarts_.push_back(proxy_->callMethod(
                start, [](sdbus::MethodReply&, const sdbus::Error*) {},
                std::uint64_t{3600} * 1000000));
        }
        // Calls of one connection are handled in order: once this is answered, every start ran.
        auto all = proxy_->createMethodCall(qv::dbus::kInterface, qv::dbus::kGetAllReporters);
        proxy_->callMethod(all);
        std::printf("started\n");
        std::fflush(stdout);
    }

    void sendAll() {
        std::int64_t sent = 0;
        while (!gone_ && (sent < options_.messages || inFlight_ > 0)) {
            while (!gone_ && inFlight_ < options_.depth && sent < options_.messages) {
                send(static_cast<std::size_t>(sent % options_.sessions));
                ++sent;
            }
            pump(true);
        }
        // The daemon is gone: the calls still out end with errors from the bus.
        while (inFlight_ > 0) {
            pump(true);
        }
    }

    void endSessions() {
        if (gone_ || options_.keepSessions) {
            return;
        }
        for (int s = 0; s < options_.sessions; ++s) {
            callBool(qv::dbus::kStopReportingSession, options_.firstID + s);
            callBool(qv::dbus::kDestroyReportingSession, options_.firstID + s);
        }
        pump(false);
    }

    void writeAnswers() const {
        if (options_.answersFile.empty()) {
            return;
        }
        std::FILE* f = std::fopen(options_.answersFile.c_str(), "w");
        if (!f) {
            std::perror(options_.answersFile.c_str());
            return;
        }
        for (const Answer& a : answers_) {
            std::fprintf(f, "%lld %lld %lld\n", static_cast<long long>(a.rid),
                         static_cast<long long>(a.seq), static_cast<long long>(a.nanos));
        }
        std::fclose(f);
    }

    void report() const {
        std::printf("done answered=%zu errors=%llu gone=%d\n", answers_.size(),
                    static_cast<unsigned long long>(errors_), gone_ ? 1 : 0);
        std::fflush(stdout);
    }

    void waitToBeKilled() {
        if (!options_.keepSessions) {
            return;
        }
        for (;;) {
            pump(true);
        }
    }

  private:
    void send(std::size_t session) {
        const std::int64_t rid = options_.firstID + static_cast<std::int64_t>(session);
        const std::int64_t seq = nextSeq_[session]++;
        Payload payload{
            {"soak_rid", sdbus::Variant(rid)},
            {"soak_seq", sdbus::Variant(seq)},
            {"session_output_running", sdbus::Variant(true)},
            {"route", sdbus::Variant(std::string("BuiltInSpeaker"))},
            {"latency_ms", sdbus::Variant(11.6)},
        };
        if (!padding_.empty()) {
            payload.emplace("padding", sdbus::Variant(padding_));
        }
        auto m = proxy_->createMethodCall(qv::dbus::kInterface, qv::dbus::kSendMessage);
        // Playback/Start (category 4, type 1), addressed to this session alone.
        m << payload << std::uint32_t{4} << std::uint16_t{1} << std::vector<std::int64_t>{rid};
        ++inFlight_;
        proxy_->callMethod(
            m,
            [this, rid, seq](sdbus::MethodReply&, const sdbus::Error* error) {
                --inFlight_;
                if (error) {
                    ++errors_;
                    // Anything but a refusal of this one call means the daemon went away.
                    const std::string name = error->getName();
                    if (name != qv::dbus::kErrorLimitsExceeded &&
                        name != qv::dbus::kErrorInvalidArgs) {
                        gone_ = true;
                    }
                    return;
                }
                answers_.push_back(Answer{rid, seq, monotonicNanos()});
                if (static_cast<std::int64_t>(answers_.size()) % options_.progressEvery == 0) {
                    std::printf("progress %zu\n", answers_.size());
                    std::fflush(stdout);
                }
            },
            std::uint64_t{120} * 1000000);
    }

    void callBool(const char* member, std::int64_t rid) {
        auto m = proxy_->createMethodCall(qv::dbus::kInterface, member);
        m << rid;
        proxy_->callMethod(m);
    }

    // Dispatches what has arrived; with wait, first waits up to 100 ms for something to.
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

    const Options options_;
    std::unique_ptr<sdbus::IConnection> connection_;
    std::unique_ptr<sdbus::IProxy> proxy_;
    const std::string padding_;
    std::vector<std::int64_t> nextSeq_;
    std::vector<sdbus::PendingAsyncCall> heldStarts_;
    std::vector<Answer> answers_;
    std::size_t inFlight_ = 0;
    std::uint64_t errors_ = 0;
    bool gone_ = false;
};

}  // namespace

int main(int argc, char** argv) {
    Options options;
    if (!parse(argc, argv, options)) {
        std::fprintf(stderr,
                     "usage: %s --address ADDR --first-id ID [--sessions N] [--messages N] "
                     "[--depth N] [--padding BYTES] [--progress N] [--answers FILE] "
                     "[--keep-sessions]\n",
                     argv[0]);
        return 2;
    }
    try {
        SoakClient client(options);
        client.beginSessions();
        client.sendAll();
        client.writeAnswers();
        client.endSessions();
        client.report();
        client.waitToBeKilled();
    } catch (const sdbus::Error& e) {
        std::fprintf(stderr, "soak client %lld: %s: %s\n", static_cast<long long>(options.firstID),
                     e.getName().c_str(), e.getMessage().c_str());
        return 1;
    }
    return 0;
}
