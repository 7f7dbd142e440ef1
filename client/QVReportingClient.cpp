#include "QVReportingClient.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <future>
#include <limits>
#include <type_traits>
#include <utility>

#include "QVReportingDBusNames.h"

namespace qv::client {

namespace {

constexpr const char* kErrorServiceUnknown = "org.freedesktop.DBus.Error.ServiceUnknown";
constexpr const char* kErrorNameHasNoOwner = "org.freedesktop.DBus.Error.NameHasNoOwner";
constexpr const char* kErrorAccessDenied = "org.freedesktop.DBus.Error.AccessDenied";
constexpr const char* kErrorNoReply = "org.freedesktop.DBus.Error.NoReply";
constexpr const char* kErrorFailed = "org.freedesktop.DBus.Error.Failed";
constexpr const char* kErrorDisconnected = "org.freedesktop.DBus.Error.Disconnected";
// What sd-bus names errnos it has no D-Bus name for.
constexpr const char* kErrorNotConnected = "System.Error.ENOTCONN";
constexpr const char* kErrorBrokenPipe = "System.Error.EPIPE";

constexpr const char* kBusDaemonName = "org.freedesktop.DBus";
constexpr const char* kBusDaemonPath = "/org/freedesktop/DBus";
constexpr const char* kBusDaemonInterface = "org.freedesktop.DBus";

// sd-bus reads a time-out of 0 as "the connection's default" (25 s unless changed) and
// UINT64_MAX as "none". A start reply is held for as long as the session runs, so the default
// would fail every session longer than 25 s with NoReply.
constexpr std::uint64_t kNoTimeout = std::numeric_limits<std::uint64_t>::max();

// A broken connection's loop is entered again this often, each time failing what was still
// waiting for a reply, before it is left for good.
constexpr int kLoopFailuresBeforeGivingUp = 64;

// Runs a blocking call, turning a bus error into ours.
template <typename F>
auto translated(F&& f) -> decltype(f()) {
    try {
        return f();
    } catch (const sdbus::Error& e) {
        throw QVReportingClientError::fromDBus(e);
    }
}

// Blocks until an asynchronous call answers; the answer arrives on the event-loop thread.
template <typename T>
struct Waiter {
    std::promise<T> promise;
    QVReportingClient::Reply<T> reply() {
        return [this](const QVReportingClientError* error, T result) {
            if (error) {
                promise.set_exception(std::make_exception_ptr(*error));
            } else {
                promise.set_value(std::move(result));
            }
        };
    }
    T wait() { return promise.get_future().get(); }
};

// The call failed because the connection itself ended (the daemon on its far end left). When
// the far end closes before the call is sent, sd-bus fails it with ENOTCONN or EPIPE, which
// carry no D-Bus name of their own.
bool isConnectionGone(const QVReportingClientError& e) {
    return e.name() == kErrorNoReply || e.name() == kErrorDisconnected ||
           e.name() == kErrorNotConnected || e.name() == kErrorBrokenPipe;
}

QVReportingClientError notRunningError() {
    return {kErrorNameHasNoOwner,
            std::string("the reporting daemon is not running on this bus (nobody owns ") +
                dbus::kBusName + ")"};
}

}  // namespace

QVReportingClientError::QVReportingClientError(std::string name, std::string message)
    : std::runtime_error(message), name_(std::move(name)), message_(std::move(message)) {}

bool QVReportingClientError::isDaemonNotRunning() const {
    return name_ == kErrorServiceUnknown || name_ == kErrorNameHasNoOwner;
}

bool QVReportingClientError::isReportingDisabled() const {
    return name_ == dbus::kErrorReportingDisabled;
}

QVReportingClientError QVReportingClientError::fromDBus(const sdbus::Error& error) {
    const std::string& name = error.getName();
    const std::string& message = error.getMessage();
    if (name == kErrorServiceUnknown || name == kErrorNameHasNoOwner) {
        return {name, std::string("the reporting daemon is not running on this bus (nobody owns ") +
                          dbus::kBusName + "): " + message};
    }
    if (name == kErrorAccessDenied) {
        return {name, "the bus policy refused the call: " + message};
    }
    if (name == dbus::kErrorLimitsExceeded) {
        return {name, "the daemon refused input beyond its limits: " + message};
    }
    if (name == dbus::kErrorInvalidArgs) {
        return {name, "the daemon refused the arguments: " + message};
    }
    return {name, message.empty() ? name : message};
}

// --- Connecting -------------------------------------------------------------------------------

std::unique_ptr<QVReportingClient> QVReportingClient::make(
    const std::function<std::unique_ptr<sdbus::IConnection>()>& open, const std::string& what,
    bool direct) {
    std::unique_ptr<sdbus::IConnection> connection;
    try {
        connection = open();
    } catch (const sdbus::Error& e) {
        throw QVReportingClientError(e.getName(),
                                     "cannot connect to " + what + ": " + e.getMessage());
    }
    return std::unique_ptr<QVReportingClient>(new QVReportingClient(std::move(connection), direct));
}

std::unique_ptr<QVReportingClient> QVReportingClient::connectToSystemBus() {
    return make([] { return sdbus::createSystemBusConnection(); }, "the system bus");
}

std::unique_ptr<QVReportingClient> QVReportingClient::connectToSessionBus() {
    return make([] { return sdbus::createSessionBusConnection(); }, "the session bus");
}

std::unique_ptr<QVReportingClient> QVReportingClient::connectToAddress(const std::string& address) {
    return make([&] { return sdbus::createSessionBusConnectionWithAddress(address); },
                "the bus at " + address);
}

std::unique_ptr<QVReportingClient> QVReportingClient::connect(const std::string& bus) {
    if (bus == "system") {
        return connectToSystemBus();
    }
    if (bus == "session") {
        return connectToSessionBus();
    }
    if (bus.empty()) {
        throw QVReportingClientError(kErrorFailed,
                                     "no bus given: use system, session or a bus address");
    }
    return connectToAddress(bus);
}

QVReportingClient::QVReportingClient(std::unique_ptr<sdbus::IConnection> connection, bool direct)
    : connection_(std::move(connection)), direct_(direct) {
    translated([&] {
        reporting_ = sdbus::createProxy(*connection_, dbus::kBusName, dbus::kObjectPath);
        notify_ = sdbus::createProxy(*connection_, dbus::kBusName, dbus::kNotifyObjectPath);
        bus_ = sdbus::createProxy(*connection_, kBusDaemonName, kBusDaemonPath);
        return 0;
    });
    // The event loop runs on a thread of the client's own rather than sdbus-c++'s, whose thread
    // ends the process when its connection breaks: a direct connection breaks whenever the
    // daemon restarts. Broken, the loop is entered again, so that sd-bus fails every call still
    // waiting (NoReply) instead of leaving it waiting for ever; then it ends.
    loopThread_ = std::thread([this] {
        for (int failures = 0; failures < kLoopFailuresBeforeGivingUp;) {
            try {
                connection_->enterEventLoop();
                return;
            } catch (const sdbus::Error&) {
                ++failures;
            }
        }
    });
}

std::unique_ptr<QVReportingClient> QVReportingClient::connectDirect(const std::string& path) {
    // A socket nobody listens on (left by a daemon that is gone) is refused here: sdbus-c++
    // leaks the sd-bus object of a connection that fails to start.
    const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    int error = fd < 0 ? errno : 0;
    if (fd >= 0 && path.size() >= sizeof address.sun_path) {
        error = ENAMETOOLONG;
    } else if (fd >= 0) {
        path.copy(address.sun_path, path.size());
        if (::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
            error = errno;
        }
    }
    if (fd >= 0) {
        ::close(fd);
    }
    if (error != 0) {
        throw QVReportingClientError(
            std::string("System.Error.") + ::strerrorname_np(error),
            "cannot connect to the daemon's direct socket " + path + ": " + std::strerror(error));
    }
    // The daemon's socket answers Hello as a bus would, so a connection opened as to a bus works
    // there unchanged.
    return make([&] { return sdbus::createSessionBusConnectionWithAddress("unix:path=" + path); },
                "the daemon's direct socket " + path, true);
}

std::unique_ptr<QVReportingClient> QVReportingClient::connect(const std::string& bus,
                                                              QVReportingTransport transport,
                                                              const std::string& directSocket) {
    const std::string path = !directSocket.empty() ? directSocket
                             : bus == "system"     ? std::string(kQVReportingDefaultDirectSocket)
                                                   : std::string();
    switch (transport) {
        case QVReportingTransport::Bus:
            return connect(bus);
        case QVReportingTransport::Direct:
            if (path.empty()) {
                throw QVReportingClientError(kErrorFailed,
                                             "no direct socket for the bus " + bus + ": name one");
            }
            return connectDirect(path);
        case QVReportingTransport::Auto:
            break;
    }
    struct stat st {};
    if (!path.empty() && ::stat(path.c_str(), &st) == 0 && S_ISSOCK(st.st_mode)) {
        try {
            return connectDirect(path);
        } catch (const QVReportingClientError&) {
            // A socket left by a daemon that is gone, or one this user may not open: the bus
            // still reaches the daemon (and can start it).
        }
    }
    return connect(bus);
}

QVReportingClient::~QVReportingClient() {
    // Stop the event-loop thread first, so no reply handler runs while the proxies go; the
    // proxies then drop their pending calls without calling them.
    connection_->leaveEventLoop();
    if (loopThread_.joinable()) {
        loopThread_.join();
    }
    bus_.reset();
    notify_.reset();
    reporting_.reset();
}

std::string QVReportingClient::uniqueName() const {
    return translated([&] { return connection_->getUniqueName(); });
}

// --- Plumbing ---------------------------------------------------------------------------------

sdbus::MethodCall QVReportingClient::call(const char* method) {
    return translated([&] { return reporting_->createMethodCall(dbus::kInterface, method); });
}

void QVReportingClient::sendAsync(const sdbus::MethodCall& call,
                                  std::function<void(sdbus::MethodReply&)> handle,
                                  std::function<void(const QVReportingClientError&)> fail,
                                  std::uint64_t timeoutMicroseconds) {
    auto onReply = [handle = std::move(handle), fail](sdbus::MethodReply& reply,
                                                      const sdbus::Error* error) {
        if (error) {
            fail(QVReportingClientError::fromDBus(*error));
            return;
        }
        handle(reply);
    };
    // Every proxy sends on the same connection; the message itself names its object.
    translated([&] {
        (void)reporting_->callMethod(call, std::move(onReply), timeoutMicroseconds);
        return 0;
    });
}

std::string QVReportingClient::daemonOwner() {
    try {
        auto request = bus_->createMethodCall(kBusDaemonInterface, "GetNameOwner");
        request << std::string(dbus::kBusName);
        auto reply = bus_->callMethod(request);
        std::string owner;
        reply >> owner;
        return owner;
    } catch (const sdbus::Error& e) {
        if (e.getName() == kErrorNameHasNoOwner) {
            return {};
        }
        throw QVReportingClientError::fromDBus(e);
    }
}

// --- Operations -------------------------------------------------------------------------------

template <typename T, typename... Args>
T QVReportingClient::invoke(const char* method, const Args&... args) {
    auto c = call(method);
    return translated([&] {
        (void)(c << ... << args);
        auto reply = reporting_->callMethod(c);
        if constexpr (std::is_void_v<T>) {
            (void)reply;
        } else {
            T value{};
            reply >> value;
            return value;
        }
    });
}

template <typename T, typename... Args>
void QVReportingClient::invokeAsync(const char* method, Reply<T> reply,
                                    std::uint64_t timeoutMicroseconds, const Args&... args) {
    auto shared = std::make_shared<Reply<T>>(std::move(reply));
    auto handle = [shared](sdbus::MethodReply& message) {
        T result{};
        try {
            message >> result;
        } catch (const sdbus::Error& e) {
            const auto error = QVReportingClientError::fromDBus(e);
            (*shared)(&error, T{});
            return;
        }
        (*shared)(nullptr, std::move(result));
    };
    auto fail = [shared](const QVReportingClientError& error) { (*shared)(&error, T{}); };
    try {
        auto c = call(method);
        translated([&] {
            (void)(c << ... << args);
            return 0;
        });
        sendAsync(c, std::move(handle), std::move(fail), timeoutMicroseconds);
    } catch (const QVReportingClientError& error) {
        (*shared)(&error, T{});
    }
}

bool QVReportingClient::createReportingSession(std::int64_t reporterID) {
    return invoke<bool>(dbus::kCreateReportingSession, reporterID);
}

bool QVReportingClient::setServiceType(std::uint16_t serviceType, std::int64_t reporterID) {
    return invoke<bool>(dbus::kSetServiceType, serviceType, reporterID);
}

std::uint16_t QVReportingClient::getServiceNameForReporterID(std::int64_t reporterID) {
    return invoke<std::uint16_t>(dbus::kGetServiceNameForReporterID, reporterID);
}

bool QVReportingClient::setConfiguration(const VariantMap& configuration, std::int64_t reporterID) {
    return invoke<bool>(dbus::kSetConfiguration, configuration, reporterID);
}

bool QVReportingClient::startReportingSession(std::int64_t reporterID) {
    Waiter<bool> waiter;
    startReportingSessionAsync(reporterID, waiter.reply());
    return waiter.wait();
}

void QVReportingClient::sendMessage(const VariantMap& payload, std::uint32_t category,
                                    std::uint16_t type,
                                    const std::vector<std::int64_t>& reporterIDs) {
    invoke<void>(dbus::kSendMessage, payload, category, type, reporterIDs);
}

bool QVReportingClient::stopReportingSession(std::int64_t reporterID) {
    return invoke<bool>(dbus::kStopReportingSession, reporterID);
}

bool QVReportingClient::destroyReportingSession(std::int64_t reporterID) {
    return invoke<bool>(dbus::kDestroyReportingSession, reporterID);
}

VariantMap QVReportingClient::reporterIDValid(std::int64_t reporterID) {
    return invoke<VariantMap>(dbus::kReporterIDValid, reporterID);
}

std::vector<std::int64_t> QVReportingClient::getAllReporters() {
    return invoke<std::vector<std::int64_t>>(dbus::kGetAllReporters);
}

void QVReportingClient::killService() {
    // Asking first keeps a bus that can start the daemon on demand from starting it only to
    // kill it, and tells the daemon's exit apart from a call that merely timed out.
    const std::string owner = daemonOwner();
    if (owner.empty()) {
        throw notRunningError();
    }
    try {
        invoke<bool>(dbus::kKillService);
    } catch (const QVReportingClientError& e) {
        // The daemon never answers; the bus answers NoReply for it when it leaves, and a direct
        // connection breaks with it.
        if (direct_ ? !isConnectionGone(e) : e.name() != kErrorNoReply || daemonOwner() == owner) {
            throw;
        }
    }
}

VariantMap QVReportingClient::getStats() {
    return translated([&] {
        auto c = reporting_->createMethodCall(dbus::kStatsInterface, dbus::kGetStats);
        auto reply = reporting_->callMethod(c);
        VariantMap stats;
        reply >> stats;
        return stats;
    });
}

void QVReportingClient::postNotification(const std::string& name, std::uint64_t state) {
    translated([&] {
        auto c = notify_->createMethodCall(dbus::kNotifyInterface, dbus::kPost);
        c << name << state;
        (void)notify_->callMethod(c);
        return 0;
    });
}

std::uint64_t QVReportingClient::getNotificationState(const std::string& name) {
    return translated([&] {
        auto c = notify_->createMethodCall(dbus::kNotifyInterface, dbus::kGetState);
        c << name;
        auto reply = notify_->callMethod(c);
        std::uint64_t state = 0;
        reply >> state;
        return state;
    });
}

void QVReportingClient::createReportingSessionAsync(std::int64_t reporterID, Reply<bool> reply) {
    invokeAsync(dbus::kCreateReportingSession, std::move(reply), 0, reporterID);
}

void QVReportingClient::setServiceTypeAsync(std::uint16_t serviceType, std::int64_t reporterID,
                                            Reply<bool> reply) {
    invokeAsync(dbus::kSetServiceType, std::move(reply), 0, serviceType, reporterID);
}

void QVReportingClient::getServiceNameForReporterIDAsync(std::int64_t reporterID,
                                                         Reply<std::uint16_t> reply) {
    invokeAsync(dbus::kGetServiceNameForReporterID, std::move(reply), 0, reporterID);
}

void QVReportingClient::setConfigurationAsync(const VariantMap& configuration,
                                              std::int64_t reporterID, Reply<bool> reply) {
    invokeAsync(dbus::kSetConfiguration, std::move(reply), 0, configuration, reporterID);
}

void QVReportingClient::startReportingSessionAsync(std::int64_t reporterID, Reply<bool> reply) {
    invokeAsync(dbus::kStartReportingSession, std::move(reply), kNoTimeout, reporterID);
}

void QVReportingClient::sendMessageAsync(const VariantMap& payload, std::uint32_t category,
                                         std::uint16_t type,
                                         const std::vector<std::int64_t>& reporterIDs, Done reply) {
    auto shared = std::make_shared<Done>(std::move(reply));
    try {
        auto c = call(dbus::kSendMessage);
        translated([&] {
            c << payload << category << type << reporterIDs;
            return 0;
        });
        sendAsync(
            c, [shared](sdbus::MethodReply&) { (*shared)(nullptr); },
            [shared](const QVReportingClientError& e) { (*shared)(&e); });
    } catch (const QVReportingClientError& e) {
        (*shared)(&e);
    }
}

void QVReportingClient::stopReportingSessionAsync(std::int64_t reporterID, Reply<bool> reply) {
    invokeAsync(dbus::kStopReportingSession, std::move(reply), 0, reporterID);
}

void QVReportingClient::destroyReportingSessionAsync(std::int64_t reporterID, Reply<bool> reply) {
    invokeAsync(dbus::kDestroyReportingSession, std::move(reply), 0, reporterID);
}

void QVReportingClient::reporterIDValidAsync(std::int64_t reporterID, Reply<VariantMap> reply) {
    invokeAsync(dbus::kReporterIDValid, std::move(reply), 0, reporterID);
}

void QVReportingClient::getAllReportersAsync(Reply<std::vector<std::int64_t>> reply) {
    invokeAsync(dbus::kGetAllReporters, std::move(reply), 0);
}

void QVReportingClient::killServiceAsync(Done reply) {
    auto shared = std::make_shared<Done>(std::move(reply));
    // The same steps as killService, each on the event-loop thread as its answer arrives.
    auto askOwner = [this](std::function<void(const QVReportingClientError*, std::string)> then) {
        try {
            auto request = bus_->createMethodCall(kBusDaemonInterface, "GetNameOwner");
            request << std::string(dbus::kBusName);
            (void)bus_->callMethod(request, [then](sdbus::MethodReply& m, const sdbus::Error* e) {
                if (e && e->getName() == kErrorNameHasNoOwner) {
                    then(nullptr, {});
                } else if (e) {
                    const auto error = QVReportingClientError::fromDBus(*e);
                    then(&error, {});
                } else {
                    std::string owner;
                    try {
                        m >> owner;
                    } catch (const sdbus::Error& readError) {
                        const auto error = QVReportingClientError::fromDBus(readError);
                        then(&error, {});
                        return;
                    }
                    then(nullptr, owner);
                }
            });
        } catch (const sdbus::Error& e) {
            const auto error = QVReportingClientError::fromDBus(e);
            then(&error, {});
        }
    };
    askOwner([this, shared, askOwner](const QVReportingClientError* error, std::string owner) {
        if (error) {
            (*shared)(error);
            return;
        }
        if (owner.empty()) {
            const auto notRunning = notRunningError();
            (*shared)(&notRunning);
            return;
        }
        auto onKillReply = [this, shared, askOwner, owner](const QVReportingClientError& e) {
            if (direct_ && isConnectionGone(e)) {
                (*shared)(nullptr);
                return;
            }
            if (e.name() != kErrorNoReply) {
                (*shared)(&e);
                return;
            }
            askOwner([shared, owner, e](const QVReportingClientError* ownerError, std::string now) {
                if (ownerError) {
                    (*shared)(ownerError);
                } else {
                    (*shared)(now == owner ? &e : nullptr);
                }
            });
        };
        try {
            sendAsync(
                call(dbus::kKillService), [shared](sdbus::MethodReply&) { (*shared)(nullptr); },
                onKillReply);
        } catch (const QVReportingClientError& e) {
            (*shared)(&e);
        }
    });
}

}  // namespace qv::client
