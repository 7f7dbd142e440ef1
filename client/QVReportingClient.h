// The client side of the audio reporting daemon's bus interface: one connection to the system
// bus, the session bus or a bus address, or straight to the daemon's direct socket (the same
// interface, peer to peer, without the broker: each call costs less), and the daemon's operations
// over it, each both blocking and asynchronous.
//
// Sessions belong to the connection that created them: when a QVReportingClient goes away, the
// daemon stops and drops every session it made. Operations on reporter IDs of other connections
// are answered with success and change nothing, except SendMessage and ReporterIDValid, which
// look across all connections.
//
// Errors: blocking calls throw QVReportingClientError; asynchronous calls hand it to their
// callback. The error carries the D-Bus error name and message; a daemon that is not on the bus
// comes out as isDaemonNotRunning() with a message that says so.
//
// Thread safety: every member may be called from any thread. Asynchronous callbacks run on the
// client's own event-loop thread, one at a time (a call that cannot even be sent calls back at
// once, on the caller's thread); a callback should return promptly, since the replies of other
// asynchronous calls wait until it returns. No callback runs after the destructor has
// returned; the destructor must not run on the event-loop thread (inside a callback), nor while
// another thread waits in a blocking call.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include <sdbus-c++/IConnection.h>
#include <sdbus-c++/IProxy.h>
#include <sdbus-c++/Types.h>

namespace qv::client {

// An a{sv}: payloads, configurations, the ReporterIDValid reply and the stats.
using VariantMap = std::map<std::string, sdbus::Variant>;

class QVReportingClientError : public std::runtime_error {
  public:
    QVReportingClientError(std::string name, std::string message);

    // The D-Bus error name, e.g. "com.korvane.audio.reporting.ReportingDisabled".
    const std::string& name() const { return name_; }
    const std::string& message() const { return message_; }

    // Nobody owns the daemon's bus name (and the bus could not start it).
    bool isDaemonNotRunning() const;
    // The daemon refused a message because reporting is disabled (error code 1).
    bool isReportingDisabled() const;

    // The error of a failed call, with a clearer message for the cases people meet.
    static QVReportingClientError fromDBus(const sdbus::Error& error);

  private:
    std::string name_;
    std::string message_;
};

// How a client reaches the daemon. Auto takes the daemon's direct socket when one is there and
// answers, and the bus otherwise.
enum class QVReportingTransport { Auto, Bus, Direct };

// The daemon's direct socket when it runs as the system service.
inline constexpr const char* kQVReportingDefaultDirectSocket = "/run/qvreportd/direct";

class QVReportingClient {
  public:
    // Callbacks of asynchronous calls: error is null on success, and result is then the reply.
    template <typename T>
    using Reply = std::function<void(const QVReportingClientError* error, T result)>;
    using Done = std::function<void(const QVReportingClientError* error)>;

    // Connects; throws QVReportingClientError when the bus cannot be reached.
    static std::unique_ptr<QVReportingClient> connectToSystemBus();
    static std::unique_ptr<QVReportingClient> connectToSessionBus();
    static std::unique_ptr<QVReportingClient> connectToAddress(const std::string& address);
    // "system", "session", or anything else taken as a bus address ("unix:path=...").
    static std::unique_ptr<QVReportingClient> connect(const std::string& bus);
    // Connects to the daemon's direct socket at path.
    static std::unique_ptr<QVReportingClient> connectDirect(const std::string& path);
    // The transport chosen: directSocket names the daemon's socket; empty, the system service's
    // (kQVReportingDefaultDirectSocket) when bus is "system", and none otherwise.
    static std::unique_ptr<QVReportingClient> connect(const std::string& bus,
                                                      QVReportingTransport transport,
                                                      const std::string& directSocket = "");
    // Whether this client talks to the daemon over its direct socket.
    bool isDirect() const { return direct_; }

    ~QVReportingClient();
    QVReportingClient(const QVReportingClient&) = delete;
    QVReportingClient& operator=(const QVReportingClient&) = delete;

    // This connection's unique bus name (":1.42").
    std::string uniqueName() const;
    // The unique bus name of the daemon's process, empty while nobody owns its name: a change
    // tells a long-lived client that the daemon restarted and its sessions are gone.
    std::string daemonOwner();

    // --- Blocking operations, in the interface's order. Each throws QVReportingClientError. ---
    bool createReportingSession(std::int64_t reporterID);
    bool setServiceType(std::uint16_t serviceType, std::int64_t reporterID);
    // Answers the service type (65535 when the ID is unknown to this connection).
    std::uint16_t getServiceNameForReporterID(std::int64_t reporterID);
    bool setConfiguration(const VariantMap& configuration, std::int64_t reporterID);
    // Returns only when the session stops (no time-out applies); see the asynchronous form.
    bool startReportingSession(std::int64_t reporterID);
    void sendMessage(const VariantMap& payload, std::uint32_t category, std::uint16_t type,
                     const std::vector<std::int64_t>& reporterIDs);
    bool stopReportingSession(std::int64_t reporterID);
    bool destroyReportingSession(std::int64_t reporterID);
    // {"reporterID": x, "serviceType": q}; "reporterID" is 0 for an unknown ID.
    VariantMap reporterIDValid(std::int64_t reporterID);
    std::vector<std::int64_t> getAllReporters();
    // Ends the daemon. Returns once its bus name has lost the process that answered it; throws
    // when the call was refused (only root may kill the daemon on the system bus).
    void killService();

    // --- Operators' and notification calls. ---
    VariantMap getStats();
    void postNotification(const std::string& name, std::uint64_t state);
    std::uint64_t getNotificationState(const std::string& name);

    // --- Asynchronous operations: they return at once and call back on the event-loop thread.
    void createReportingSessionAsync(std::int64_t reporterID, Reply<bool> reply);
    void setServiceTypeAsync(std::uint16_t serviceType, std::int64_t reporterID, Reply<bool> reply);
    void getServiceNameForReporterIDAsync(std::int64_t reporterID, Reply<std::uint16_t> reply);
    void setConfigurationAsync(const VariantMap& configuration, std::int64_t reporterID,
                               Reply<bool> reply);
    // The reply comes when the session stops (or never, for a session that was already started
    // when this call arrived). Unlike the other calls this one has no time-out.
    void startReportingSessionAsync(std::int64_t reporterID, Reply<bool> reply);
    void sendMessageAsync(const VariantMap& payload, std::uint32_t category, std::uint16_t type,
                          const std::vector<std::int64_t>& reporterIDs, Done reply);
    void stopReportingSessionAsync(std::int64_t reporterID, Reply<bool> reply);
    void destroyReportingSessionAsync(std::int64_t reporterID, Reply<bool> reply);
    void reporterIDValidAsync(std::int64_t reporterID, Reply<VariantMap> reply);
    void getAllReportersAsync(Reply<std::vector<std::int64_t>> reply);
    // Done with no error once the daemon has gone.
    void killServiceAsync(Done reply);

  private:
    QVReportingClient(std::unique_ptr<sdbus::IConnection> connection, bool direct);
    static std::unique_ptr<QVReportingClient> make(
        const std::function<std::unique_ptr<sdbus::IConnection>()>& open, const std::string& what,
        bool direct = false);

    sdbus::MethodCall call(const char* method);
    // A blocking call of a Reporting method with its arguments; T is the reply's type or void.
    template <typename T, typename... Args>
    T invoke(const char* method, const Args&... args);
    template <typename T, typename... Args>
    void invokeAsync(const char* method, Reply<T> reply, std::uint64_t timeoutMicroseconds,
                     const Args&... args);
    // Sends without waiting; handle reads the reply (on the event-loop thread) and may throw
    // sdbus::Error for a reply of the wrong shape.
    void sendAsync(const sdbus::MethodCall& call, std::function<void(sdbus::MethodReply&)> handle,
                   std::function<void(const QVReportingClientError&)> fail,
                   std::uint64_t timeoutMicroseconds = 0);

    std::unique_ptr<sdbus::IConnection> connection_;
    std::unique_ptr<sdbus::IProxy> reporting_;
    std::unique_ptr<sdbus::IProxy> notify_;
    std::unique_ptr<sdbus::IProxy> bus_;  // the bus daemon itself, for name ownership
    bool direct_ = false;
    std::thread loopThread_;  // the connection's event loop
};

}  // namespace qv::client
