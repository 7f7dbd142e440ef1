// The daemon on D-Bus: serves the reporting interface, the stats interface and the notification
// center on its bus connection and on every connection accepted on its direct socket, keeps one
// client object per unique bus name and per direct connection, and turns the name leaving the bus,
// or the direct connection closing, into the client's invalidation.
//
// Threads: one thread of its own runs the connections' event loop, and it alone touches them.
// Method handlers (sd-bus vtables, registered on each connection) decode their arguments there
// and hand the work to the service (which runs it on the reporting server queue); replies and
// signals are handed back to the loop thread through post(), which wakes it with an eventfd. (A
// reply sent from another thread would sit unflushed until the loop woke for some other reason.)
//
// Budgets: every call taken in is charged to its client until it is answered (bytes, and for
// start calls, which wait for their session's stop, a count of held calls). A client past its
// own budget has its further calls refused with LimitsExceeded before they are decoded, while the
// loop reads on for everyone else; past the budget of all clients together the loop stops
// reading every connection until the work taken in drains. A call that by the rules is never
// answered (a second start of a started session) is let go as soon as that is known, and a call
// sent without expecting a reply is never answered. Connections take turns: each is read for a
// bounded burst of calls before the next.
//
// Direct connections: peer to peer (no broker), one client each, credentials from the socket. Only
// uid 0 may call KillService there, as the bus policy allows only root on the bus. They answer
// Hello and GetNameOwner of the daemon's name as a bus would, so that a client library that
// connects to an address as to a bus works unchanged.
#pragma once

#include <sys/types.h>
#include <systemd/sd-bus.h>

#include <atomic>
#include <cstdint>
#include <deque>
#include <functional>
#include <list>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "service/QVReportingDBusCodec.h"
#include "service/QVReportingService.h"

namespace qv {

class LinuxNotificationCenter;
class QVReportingDirectSocket;

class QVReportingDBusServer {
  public:
    // Takes the bus connection (opened, not yet owning the name). notifications may be null (no
    // notification center object is served then); direct may be null (no direct socket).
    QVReportingDBusServer(sd_bus* bus, QVReportingService& service,
                          LinuxNotificationCenter* notifications,
                          std::unique_ptr<QVReportingDirectSocket> direct = nullptr);
    // Leaves the bus (stop()) if it has not yet, and closes the connection.
    ~QVReportingDBusServer();

    QVReportingDBusServer(const QVReportingDBusServer&) = delete;
    QVReportingDBusServer& operator=(const QVReportingDBusServer&) = delete;

    // Registers the objects, starts the loop thread and requests the bus name. Throws
    // std::runtime_error when the name cannot be had.
    void start();
    // Runs fn on the loop thread; false (fn dropped) once the loop has ended.
    bool post(std::function<void()> fn);
    // Blocks until every reply and signal posted so far has been handed to the connections.
    void flush();
    // Leaves the bus and closes the direct connections: ends the loop, whose thread then
    // unregisters the objects and closes the connections. Work still queued elsewhere may answer
    // calls afterwards (the answers are dropped), so the server must outlive it: stop, drain the
    // queues, then destroy.
    void stop();

    // The clients now served over the bus, and the direct connections open (for the stats).
    std::size_t clientCount() const { return busClientCount_.load(); }
    std::size_t directConnectionCount() const { return directCount_.load(); }

  private:
    struct MessageUnref {
        void operator()(sd_bus_message* m) const { sd_bus_message_unref(m); }
    };
    using MessagePtr = std::unique_ptr<sd_bus_message, MessageUnref>;
    using CallID = std::uint64_t;

    // One connection served: the bus, or one accepted on the direct socket.
    struct Connection {
        QVReportingDBusServer* server = nullptr;
        sd_bus* bus = nullptr;
        std::vector<sd_bus_slot*> slots;
        bool direct = false;
        std::string key;  // a direct connection's client key ("direct:N"; never a bus name)
        pid_t pid = 0;
        uid_t uid = 0;
    };
    struct Client {
        std::shared_ptr<QVReportingClientServerInstance> instance;
        std::string key;  // its key in clients_: the unique bus name, or the direct connection's
        bool direct = false;
        std::size_t callBytes = 0;  // of its calls not yet answered
        std::size_t heldCalls = 0;  // of them, the held ones
        // Payload bytes it may still send now (a token bucket, refilled at the payload rate).
        double payloadAllowance = 0;
        std::uint64_t allowanceMicros = 0;  // when the allowance was last refilled
    };
    struct Pending {
        MessagePtr call;
        std::string client;  // its key in clients_
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
    // Writes a reply's arguments; a negative errno when it cannot.
    using Fill = std::function<int(sd_bus_message*)>;
    using IDCall = void (QVReportingClientServerInstance::*)(
        ReporterID, QVReportingClientServerInstance::BoolReply);

    // ---- connections and the loop (QVReportingDBusServer.cpp) ----
    // Registers the objects on a connection; false when sd-bus refused.
    bool registerObjects(Connection& connection);
    void unregisterObjects(Connection& connection);
    // Once the loop has ended: unregisters everything, closes the direct connections and the
    // direct socket, and drops the calls still kept.
    void closeConnections();
    void loop();
    // Reads each connection for a burst of calls; true when any had something.
    bool processConnections();
    // Waits for any connection, the direct socket or a post.
    void waitForWork();
    void acceptDirectConnections();
    // With clientLeft, the connection's client is gone too (as when its name leaves the bus).
    void closeDirectConnection(std::list<Connection>::iterator it, bool clientLeft = true);
    // Runs what was posted; with last, also marks the loop as ended so nothing waits on it.
    void drainPosted(bool last = false);
    // A client's connection is gone: its kept calls are dropped and it is invalidated.
    void clientGone(const std::string& key);
    static int onNameOwnerChanged(sd_bus_message* signal, void* userdata, sd_bus_error* error);
    void emitPosted(const std::string& name, std::uint64_t state);

    // ---- budgets and answers (QVReportingDBusBudgets.cpp) ----
    // On the loop thread: the client of the call's connection, accepted on its first call, when
    // the call fits the client's budgets (held: a call that waits for a later event); null when
    // the call was refused instead (too many clients, or past a budget: answered with an error).
    Client* admit(Connection& connection, sd_bus_message* call, bool held = false);
    // admit() for a call whose one argument is a reporter ID, read into `id`; a call whose
    // argument cannot be read is refused (null).
    Client* admitWithID(Connection& connection, sd_bus_message* call, ReporterID& id,
                        bool held = false);
    // Keeps the call, charged to its client, until it is answered or let go.
    TicketPtr hold(sd_bus_message* call, Client& client, std::size_t argumentBytes,
                   bool held = false);
    // Takes a kept call out and gives its charge back; null when it is gone already.
    MessagePtr release(CallID id);
    // Answers a kept call on the loop thread (from any thread): with an error, or with the
    // arguments written by fill.
    void answer(const TicketPtr& ticket, const std::optional<QVReportingError>& error, Fill fill);
    // Refuses a call on the loop thread: an error reply, unless the caller expects none.
    static void refuse(sd_bus_message* call, const QVReportingError& error);
    // Microseconds on the monotonic clock, for the payload rate budget.
    static std::uint64_t monotonicMicros();
    void noteBudgets() const;

    // ---- the interfaces' methods (QVReportingDBusMethods.cpp) ----
    // The C entry point of every method: finds the connection, runs the member, and keeps
    // exceptions out of sd-bus.
    template <void (QVReportingDBusServer::*Method)(Connection&, sd_bus_message*)>
    static int dispatch(sd_bus_message* call, void* userdata, sd_bus_error* error);
    template <IDCall Op, bool Held>
    void idCall(Connection& connection, sd_bus_message* call);
    void setServiceType(Connection& connection, sd_bus_message* call);
    void getServiceNameForReporterID(Connection& connection, sd_bus_message* call);
    void setConfiguration(Connection& connection, sd_bus_message* call);
    void sendMessage(Connection& connection, sd_bus_message* call);
    void reporterIDValid(Connection& connection, sd_bus_message* call);
    void getAllReporters(Connection& connection, sd_bus_message* call);
    void killService(Connection& connection, sd_bus_message* call);
    void getStats(Connection& connection, sd_bus_message* call);
    void notifyPost(Connection& connection, sd_bus_message* call);
    void notifyGetState(Connection& connection, sd_bus_message* call);
    void hello(Connection& connection, sd_bus_message* call);
    void getNameOwner(Connection& connection, sd_bus_message* call);
    // Reads a payload or configuration; false (the call refused and counted) when it is not one.
    bool readPayload(sd_bus_message* call, Client& client, QVReportingDecodeResult& decoded);
    // A bool answer for a kept call.
    QVReportingClientServerInstance::BoolReply boolReply(TicketPtr ticket);
    static const sd_bus_vtable kReportingVtable[];
    static const sd_bus_vtable kStatsVtable[];
    static const sd_bus_vtable kNotifyVtable[];
    static const sd_bus_vtable kPeerBusVtable[];

    QVReportingService& service_;
    LinuxNotificationCenter* notifications_;
    const QVReportingLimits limits_;
    const QVReportingInputBudget budget_;
    const std::shared_ptr<Lifeline> lifeline_;
    std::unique_ptr<QVReportingDirectSocket> direct_;
    int wakeFd_ = -1;
    std::thread loopThread_;
    std::atomic<bool> stopping_{false};
    std::mutex postMutex_;
    std::deque<std::function<void()>> posted_;  // guarded by postMutex_
    bool loopEnded_ = false;                    // guarded by postMutex_
    std::atomic<bool> postedWaiting_{false};    // posted_ is not empty

    // Touched on the loop thread only (but for the bus connection's setup in start()).
    Connection bus_;
    sd_bus_slot* nameOwnerChangedSlot_ = nullptr;
    std::list<Connection> directConnections_;
    std::uint64_t nextDirectID_ = 1;
    sd_id128_t serverID_{};
    std::unordered_map<std::string, Client> clients_;
    std::unordered_map<CallID, Pending> pending_;
    CallID nextCallID_ = 1;
    std::size_t callBytes_ = 0;  // of all calls not yet answered
    std::size_t heldCalls_ = 0;  // of them, the held ones
    bool readsPaused_ = false;   // for want of call budget
    std::atomic<std::size_t> busClientCount_{0};
    std::atomic<std::size_t> directCount_{0};
};

}  // namespace qv
