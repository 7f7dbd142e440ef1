// The daemon on D-Bus: serves the reporting interface, the stats interface and the notification
// center on one bus connection, keeps one client object per unique bus name, and turns the name
// leaving the bus into the client's invalidation.
//
// Threads: one thread of its own runs the connection's event loop, and it alone touches the bus.
// Method handlers decode their arguments there and hand the work to the service (which runs it on
// the reporting server queue); replies and signals are handed back to the loop thread through
// post(), which wakes it with an eventfd. (A reply sent from another thread would sit unflushed
// until the loop woke for some other reason.)
#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <unordered_map>

#include <sdbus-c++/IConnection.h>
#include <sdbus-c++/IObject.h>
#include <sdbus-c++/Message.h>

#include "service/QVReportingService.h"

namespace qv {

class LinuxNotificationCenter;

class QVReportingDBusServer {
  public:
    // notifications may be null (no notification center object is served then).
    QVReportingDBusServer(std::unique_ptr<sdbus::IConnection> connection,
                          QVReportingService& service, LinuxNotificationCenter* notifications);
    // Leaves the bus (stop()) if it has not yet.
    ~QVReportingDBusServer();

    QVReportingDBusServer(const QVReportingDBusServer&) = delete;
    QVReportingDBusServer& operator=(const QVReportingDBusServer&) = delete;

    // Registers the objects, starts the loop thread and requests the bus name. Throws
    // sdbus::Error when the name cannot be had.
    void start();
    // Runs fn on the loop thread; false (fn dropped) once the loop has ended.
    bool post(std::function<void()> fn);
    // Blocks until every reply and signal posted so far has been handed to the bus.
    void flush();
    // Leaves the bus: unregisters the objects first, then ends the loop. Work still queued
    // elsewhere may answer calls afterwards (the answers are dropped), so the server must outlive
    // it: stop, drain the queues, then destroy.
    void stop();

    // The bus connections of clients now served (for tests and the stats).
    std::size_t clientCount() const { return clientCount_.load(); }

  private:
    using CallID = std::uint64_t;
    struct Pending {
        sdbus::MethodCall call;
        std::string sender;
    };

    void registerReportingInterface();
    void registerStatsInterface();
    void registerNotifyInterface();
    void loop();
    // Runs what was posted; with last, also marks the loop as ended so nothing waits on it.
    void drainPosted(bool last = false);

    // On the loop thread: the client of the call's sender, accepted on its first call; null when
    // the daemon serves as many clients as it may (the call is then answered with an error).
    std::shared_ptr<QVReportingClientServerInstance> clientFor(sdbus::MethodCall& call);
    void onNameOwnerChanged(sdbus::Message& signal);
    // Keeps the call until its reply is posted; returns the ID the reply names.
    CallID hold(sdbus::MethodCall call);
    // Answers a held call on the loop thread (from any thread): with an error, or with the
    // arguments written by fill.
    void answer(CallID id, const std::optional<QVReportingError>& error,
                std::function<void(sdbus::MethodReply&)> fill);
    void answerNow(sdbus::MethodCall& call, const QVReportingError& error);

    std::unique_ptr<sdbus::IConnection> connection_;
    QVReportingService& service_;
    LinuxNotificationCenter* notifications_;
    std::unique_ptr<sdbus::IObject> reporting_;
    std::unique_ptr<sdbus::IObject> notify_;
    sdbus::Slot nameOwnerChangedSlot_;

    int wakeFd_ = -1;
    std::thread loopThread_;
    std::atomic<bool> stopping_{false};
    std::mutex postMutex_;
    std::deque<std::function<void()>> posted_;  // guarded by postMutex_
    bool loopEnded_ = false;                    // guarded by postMutex_

    // Touched on the loop thread only.
    std::unordered_map<std::string, std::shared_ptr<QVReportingClientServerInstance>> clients_;
    std::unordered_map<CallID, Pending> pending_;
    CallID nextCallID_ = 1;
    std::atomic<std::size_t> clientCount_{0};
};

}  // namespace qv
