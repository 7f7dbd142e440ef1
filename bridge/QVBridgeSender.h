// The bridge's own thread that talks to the daemon: it takes the reporter's operations off the
// queue and makes the calls, blocking only itself. It keeps what each live session is made of
// (its open, whether it started, its latest state), so that when the daemon restarts or comes
// back it makes every live session again and resumes a running stream with a Start; while no
// daemon is on the bus, messages are counted as undelivered and only that state is kept.
//
// With dryRun it makes no call and prints each operation as a line of JSON instead.
#pragma once

#include <chrono>
#include <cstdint>
#include <cstdio>
#include <map>
#include <memory>
#include <string>
#include <thread>

#include "QVBridgeEvent.h"
#include "QVBridgeEventQueue.h"
#include "QVBridgeStats.h"

namespace qv::client {
class QVReportingClient;
}

namespace qv::bridge {

class QVBridgeSender {
  public:
    struct Options {
        std::string bus = "session";  // as QVReportingClient::connect takes it
        bool dryRun = false;
        std::FILE* dryRunOutput = stdout;
        // How often the daemon's presence is checked (a restarted daemon has other sessions).
        std::chrono::milliseconds ownerCheckInterval{500};
    };

    QVBridgeSender(QVBridgeEventQueue& queue, QVBridgeStats& stats, Options options);
    ~QVBridgeSender();
    QVBridgeSender(const QVBridgeSender&) = delete;
    QVBridgeSender& operator=(const QVBridgeSender&) = delete;

    void start();
    // Returns once the queue is closed and drained.
    void join();

  private:
    struct Session {
        QVBridgeEvent open;
        bool started = false;
        bool running = false;
        QVBridgePayload state;  // the latest stream state the messages carried
        bool made = false;      // exists in the daemon we talk to
    };

    void run();
    void handle(QVBridgeEvent& event);
    // Connects, asks who owns the daemon's name and, when that changed, makes the sessions again.
    void checkDaemon(bool force);
    void makeSession(std::int64_t reporterID, Session& session);
    void sendMessage(const Session& session, std::int64_t reporterID, std::uint32_t category,
                     std::uint16_t type, const QVBridgePayload& payload);
    // A call failed: log it (once until calls succeed again) and look at the daemon again.
    void callFailed(const char* what, std::int64_t reporterID, const std::exception& error);
    bool present() const { return !owner_.empty(); }

    QVBridgeEventQueue& queue_;
    QVBridgeStats& stats_;
    const Options options_;
    std::thread thread_;

    // Everything below belongs to thread_.
    std::unique_ptr<client::QVReportingClient> client_;
    std::string owner_;     // the daemon our sessions were made in; empty: none now
    bool everMet_ = false;  // a daemon was met once: a new one is a restart
    bool failing_ = false;
    bool absenceLogged_ = false;
    std::chrono::steady_clock::time_point nextCheck_{};
    std::map<std::int64_t, Session> sessions_;
};

}  // namespace qv::bridge
