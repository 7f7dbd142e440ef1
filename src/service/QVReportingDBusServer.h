// The daemon on D-Bus: serves the reporting interface, the stats interface and the notification
// center on one bus connection, keeps one client object per unique bus name, and turns the name
// leaving the bus into the client's invalidation.
//
// Threads: one thread of its own runs the connection's event loop, and it alone touches the bus.
// Method handlers decode their arguments there and hand the work to the service (which runs it on
// the reporting server queue); replies and signals are handed back to the loop thread through
// post(), which wakes it with an eventfd. (A reply sent from another thread would sit unflushed
// until the loop woke for some other reason.)
//
// Budgets: every call taken in is charged to its client until it is answered (bytes, and for
// start calls, which wait for their session's stop, a count of held calls). A client past its
// own budget has its further calls refused with LimitsExceeded before they are decoded, while the
// loop reads on for everyone else; past the budget of all clients together the loop stops
// reading the bus until the work taken in drains. A call that by the rules is never answered (a
// second start of a started session) is let go as soon as that is known, and a call sent
// without expecting a reply is never answered.
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
    struct Client {
        std::shared_ptr<QVReportingClientServerInstance> instance;
        std::size_t callBytes = 0;  // of its calls not yet answered
        std::size_t heldCalls = 0;  // of them, the held ones
        // Payload bytes it may still send now (a token bucket, refilled at the payload rate).
        double payloadAllowance;
        std::uint64_t allowanceMicros;  // when the allowance was last refilled
    };
    struct Pending {
        sdbus::MethodCall call;
        std::string sender;
        std::size_t bytes;
        bool held;
    };
    // The server as reply callbacks see it: they may outlive it (a session that holds a start
    // reply past shutdown), so they reach it through this, which the server clears as it goes.
    struct Lifeline {
        std::mutex mutex;
        QVReportingDBusServer* server = nullptr;  // guarded by mutex
    };
    // A taken-in call's claim on its answer, carried by the reply callback: answer() marks it;
    // when the last copy goes unanswered, the call is let go without a reply.
    struct Ticket {
        Ticket(std::shared_ptr<Lifeline> l, CallID i) : lifeline(std::move(l)), id(i) {}
        ~Ticket();
        const std::shared_ptr<Lifeline> lifeline;
        const CallID id;
        std::atomic<bool> answered{false};
    };
    using TicketPtr = std::shared_ptr<Ticket>;

    void registerReportingInterface();
    void registerStatsInterface();
    void registerNotifyInterface();
    void loop();
    // Runs what was posted; with last, also marks the loop as ended so nothing waits on it.
    void drainPosted(bool last = false);

    // On the loop thread: the client of the call's sender, accepted on its first call, when the
    // call fits the client's budgets (held: a call that waits for a later event); null when the
    // call was refused instead (too many clients, or past a budget: answered with an error).
    Client* admit(sdbus::MethodCall& call, bool held = false);
    void onNameOwnerChanged(sdbus::Message& signal);
    // Keeps the call, charged to its client, until it is answered or let go.
    TicketPtr hold(sdbus::MethodCall call, Client& client, std::size_t argumentBytes,
                   bool held = false);
    // Takes a kept call out and gives its charge back; an empty call when it is gone already.
    sdbus::MethodCall release(CallID id);
    // Answers a kept call on the loop thread (from any thread): with an error, or with the
    // arguments written by fill.
    void answer(const TicketPtr& ticket, const std::optional<QVReportingError>& error,
                std::function<void(sdbus::MethodReply&)> fill);
    // Refuses a call on the loop thread: an error reply, unless the caller expects none.
    void refuse(sdbus::MethodCall& call, const QVReportingError& error);
    void noteBudgets() const;
    // Takes a payload's bytes out of its client's allowance.
    void chargePayload(Client& client, std::size_t bytes);

    std::unique_ptr<sdbus::IConnection> connection_;
    QVReportingService& service_;
    LinuxNotificationCenter* notifications_;
    std::unique_ptr<sdbus::IObject> reporting_;
    std::unique_ptr<sdbus::IObject> notify_;
    sdbus::Slot nameOwnerChangedSlot_;

    const QVReportingLimits limits_;
    const std::shared_ptr<Lifeline> lifeline_;
    int wakeFd_ = -1;
    std::thread loopThread_;
    std::atomic<bool> stopping_{false};
    std::mutex postMutex_;
    std::deque<std::function<void()>> posted_;  // guarded by postMutex_
    bool loopEnded_ = false;                    // guarded by postMutex_
    std::atomic<bool> postedWaiting_{false};    // posted_ is not empty

    // Touched on the loop thread only.
    std::unordered_map<std::string, Client> clients_;
    std::unordered_map<CallID, Pending> pending_;
    CallID nextCallID_ = 1;
    std::size_t callBytes_ = 0;  // of all calls not yet answered
    std::size_t heldCalls_ = 0;  // of them, the held ones
    bool readsPaused_ = false;   // for want of call budget
    std::atomic<std::size_t> clientCount_{0};
};

}  // namespace qv
