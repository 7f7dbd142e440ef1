#include "service/QVReportingDBusServer.h"

#include <poll.h>
#include <pthread.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <time.h>
#include <unistd.h>

#include <future>

#include <sdbus-c++/sdbus-c++.h>

#include "platform/linux/LinuxNotificationCenter.h"
#include "service/QVReportingDBusCodec.h"
#include "service/QVReportingDBusNames.h"
#include "session/QVReportingLog.h"

namespace qv {

namespace {

const QVReportingLogCategory& logCategory() {
    return QVReportingServiceDelegateCategory();
}

std::uint64_t monotonicMicros() {
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<std::uint64_t>(ts.tv_sec) * 1000000u +
           static_cast<std::uint64_t>(ts.tv_nsec) / 1000u;
}

sdbus::Error toBusError(const QVReportingError& e) {
    return sdbus::Error(e.name, e.message);
}

}  // namespace

QVReportingDBusServer::QVReportingDBusServer(std::unique_ptr<sdbus::IConnection> connection,
                                             QVReportingService& service,
                                             LinuxNotificationCenter* notifications)
    : connection_(std::move(connection)), service_(service), notifications_(notifications) {
    wakeFd_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    if (wakeFd_ < 0) {
        throw sdbus::Error("org.freedesktop.DBus.Error.Failed", "eventfd failed");
    }
}

QVReportingDBusServer::~QVReportingDBusServer() {
    stop();
    ::close(wakeFd_);
}

void QVReportingDBusServer::stop() {
    if (notifications_) {
        notifications_->setPostObserver(nullptr);
    }
    if (loopThread_.joinable()) {
        // Unregister on the loop thread, which alone touches the bus, then end the loop.
        post([this] {
            reporting_.reset();
            notify_.reset();
            nameOwnerChangedSlot_.reset();
            pending_.clear();
            stopping_ = true;
        });
        loopThread_.join();
    }
}

void QVReportingDBusServer::start() {
    registerReportingInterface();
    registerStatsInterface();
    reporting_->finishRegistration();
    if (notifications_) {
        registerNotifyInterface();
        notify_->finishRegistration();
        notifications_->setPostObserver([this](const std::string& name, std::uint64_t state) {
            post([this, name, state] {
                if (notify_) {
                    notify_->emitSignal(dbus::kPosted)
                        .onInterface(dbus::kNotifyInterface)
                        .withArguments(name, state);
                }
            });
        });
    }
    nameOwnerChangedSlot_ = connection_->addMatch(
        "type='signal',sender='org.freedesktop.DBus',interface='org.freedesktop.DBus',"
        "member='NameOwnerChanged',path='/org/freedesktop/DBus'",
        [this](sdbus::Message& signal) { onNameOwnerChanged(signal); });
    connection_->requestName(dbus::kBusName);
    QVLOG_DEFAULT(logCategory(), "owning bus name {} as {}", dbus::kBusName,
                  connection_->getUniqueName());
    loopThread_ = std::thread([this] {
        loop();
        drainPosted(true);
    });
}

bool QVReportingDBusServer::post(std::function<void()> fn) {
    {
        // A loop that ended (the bus was lost) runs nothing more.
        std::lock_guard lock(postMutex_);
        if (loopEnded_) {
            return false;
        }
        posted_.push_back(std::move(fn));
    }
    const std::uint64_t one = 1;
    [[maybe_unused]] const auto n = ::write(wakeFd_, &one, sizeof one);
    return true;
}

void QVReportingDBusServer::flush() {
    if (!loopThread_.joinable() || loopThread_.get_id() == std::this_thread::get_id()) {
        return;
    }
    std::promise<void> done;
    auto future = done.get_future();
    if (post([&done] { done.set_value(); })) {
        future.wait();
    }
}

void QVReportingDBusServer::drainPosted(bool last) {
    std::uint64_t count = 0;
    [[maybe_unused]] const auto n = ::read(wakeFd_, &count, sizeof count);
    std::deque<std::function<void()>> batch;
    {
        std::lock_guard lock(postMutex_);
        batch.swap(posted_);
        loopEnded_ = loopEnded_ || last;
    }
    for (auto& fn : batch) {
        try {
            fn();
        } catch (const sdbus::Error& e) {
            QVLOG_ERROR(logCategory(), "bus error: {} {}", e.getName(), e.getMessage());
        }
    }
}

void QVReportingDBusServer::loop() {
    pthread_setname_np(pthread_self(), "qvreportd-bus");
    while (!stopping_) {
        try {
            while (connection_->processPendingRequest()) {
                if (stopping_) {
                    return;
                }
            }
            const auto data = connection_->getEventLoopPollData();
            int timeoutMs = -1;
            if (data.timeout_usec != UINT64_MAX) {
                const std::uint64_t now = monotonicMicros();
                timeoutMs = data.timeout_usec <= now
                                ? 0
                                : static_cast<int>(std::min<std::uint64_t>(
                                      (data.timeout_usec - now + 999) / 1000, 60000));
            }
            pollfd fds[2] = {{data.fd, data.events, 0}, {wakeFd_, POLLIN, 0}};
            if (::poll(fds, 2, timeoutMs) < 0 && errno != EINTR) {
                QVLOG_ERROR(logCategory(), "poll failed: {}", errno);
            }
            if (fds[1].revents & POLLIN) {
                drainPosted();
            }
        } catch (const sdbus::Error& e) {
            // Processing fails only when the connection itself broke: without a bus there is
            // nothing to serve, so stop the daemon the normal way.
            QVLOG_ERROR(logCategory(), "lost the bus: {} {}", e.getName(), e.getMessage());
            ::kill(::getpid(), SIGTERM);
            return;
        }
    }
}

std::shared_ptr<QVReportingClientServerInstance> QVReportingDBusServer::clientFor(
    sdbus::MethodCall& call) {
    const std::string sender = call.getSender();
    if (auto it = clients_.find(sender); it != clients_.end()) {
        return it->second;
    }
    // Asking the bus for the peer's PID is a round trip: done once per connection.
    std::int64_t pid = 0;
    try {
        pid = call.getCredsPid();
    } catch (const sdbus::Error& e) {
        QVLOG_ERROR(logCategory(), "no process ID for {}: {}", sender, e.getMessage());
    }
    auto client = service_.acceptConnection(pid);
    if (client) {
        clients_.emplace(sender, client);
        clientCount_ = clients_.size();
    }
    return client;
}

void QVReportingDBusServer::onNameOwnerChanged(sdbus::Message& signal) {
    std::string name, oldOwner, newOwner;
    signal >> name >> oldOwner >> newOwner;
    if (!newOwner.empty()) {
        return;
    }
    // Calls still held for the departed name can never be answered.
    std::erase_if(pending_, [&](const auto& entry) { return entry.second.sender == name; });
    auto it = clients_.find(name);
    if (it == clients_.end()) {
        return;
    }
    auto client = std::move(it->second);
    clients_.erase(it);
    clientCount_ = clients_.size();
    QVLOG_DEFAULT(logCategory(), "interruptionHandler: connection exited");
    service_.connectionInvalidated(client);
}

QVReportingDBusServer::CallID QVReportingDBusServer::hold(sdbus::MethodCall call) {
    const CallID id = nextCallID_++;
    std::string sender = call.getSender();
    pending_.emplace(id, Pending{std::move(call), std::move(sender)});
    return id;
}

void QVReportingDBusServer::answer(CallID id, const std::optional<QVReportingError>& error,
                                   std::function<void(sdbus::MethodReply&)> fill) {
    post([this, id, error, fill = std::move(fill)] {
        auto it = pending_.find(id);
        if (it == pending_.end()) {
            return;  // the caller left the bus
        }
        sdbus::MethodCall call = std::move(it->second.call);
        pending_.erase(it);
        if (error) {
            call.createErrorReply(toBusError(*error)).send();
            return;
        }
        auto reply = call.createReply();
        if (fill) {
            fill(reply);
        }
        reply.send();
    });
}

void QVReportingDBusServer::answerNow(sdbus::MethodCall& call, const QVReportingError& error) {
    call.createErrorReply(toBusError(error)).send();
}

void QVReportingDBusServer::registerReportingInterface() {
    reporting_ = sdbus::createObject(*connection_, dbus::kObjectPath);
    const std::string iface = dbus::kInterface;
    const QVReportingLimits& limits = service_.limits();
    const QVReportingInputBudget budget{limits.maxPayloadBytes, limits.maxPayloadValues,
                                        limits.maxPayloadDepth};

    auto boolReply = [this](CallID id) {
        return [this, id](const std::optional<QVReportingError>& error, bool result) {
            answer(id, error, [result](sdbus::MethodReply& r) { r << result; });
        };
    };
    // Handlers for the methods that take one reporter ID and answer a bool.
    using IDCall = void (QVReportingClientServerInstance::*)(
        ReporterID, QVReportingClientServerInstance::BoolReply);
    auto registerIDCall = [&](const char* member, IDCall op) {
        reporting_->registerMethod(
            iface, member, "x", {"reporterID"}, "b", {"result"},
            [this, op, boolReply](sdbus::MethodCall call) {
                auto client = clientFor(call);
                if (!client) {
                    return answerNow(call, QVReportingError::limitsExceeded("too many clients"));
                }
                ReporterID id = 0;
                call >> id;
                ((*client).*op)(id, boolReply(hold(std::move(call))));
            });
    };

    registerIDCall(dbus::kCreateReportingSession,
                   &QVReportingClientServerInstance::createReportingSession);

    reporting_->registerMethod(
        iface, dbus::kSetServiceType, "qx", {"serviceType", "reporterID"}, "b", {"result"},
        [this, boolReply](sdbus::MethodCall call) {
            auto client = clientFor(call);
            if (!client) {
                return answerNow(call, QVReportingError::limitsExceeded("too many clients"));
            }
            std::uint16_t type = 0;
            ReporterID id = 0;
            call >> type >> id;
            client->setServiceType(type, id, boolReply(hold(std::move(call))));
        });

    reporting_->registerMethod(
        iface, dbus::kGetServiceNameForReporterID, "x", {"reporterID"}, "q", {"serviceType"},
        [this](sdbus::MethodCall call) {
            auto client = clientFor(call);
            if (!client) {
                return answerNow(call, QVReportingError::limitsExceeded("too many clients"));
            }
            ReporterID id = 0;
            call >> id;
            const CallID held = hold(std::move(call));
            client->getServiceNameForReporterID(
                id, [this, held](const std::optional<QVReportingError>& e, AudioServiceType t) {
                    answer(held, e, [t](sdbus::MethodReply& r) { r << t; });
                });
        });

    reporting_->registerMethod(
        iface, dbus::kSetConfiguration, "a{sv}x", {"configuration", "reporterID"}, "b", {"result"},
        [this, budget, boolReply](sdbus::MethodCall call) {
            auto client = clientFor(call);
            if (!client) {
                return answerNow(call, QVReportingError::limitsExceeded("too many clients"));
            }
            auto decoded = QVReportingReadDictionary(call, budget);
            if (decoded.error) {
                decoded.limit ? QVReportingStats::shared().noteLimitExceeded(*decoded.limit)
                              : QVReportingStats::shared().noteInputRefused();
                return answerNow(call, *decoded.error);
            }
            ReporterID id = 0;
            QVReportingReadRest(call, decoded, id);
            client->setConfiguration(std::move(decoded.dictionary), id,
                                     boolReply(hold(std::move(call))));
        });

    registerIDCall(dbus::kStartReportingSession,
                   &QVReportingClientServerInstance::startReportingSessionForID);

    reporting_->registerMethod(
        iface, dbus::kSendMessage, "a{sv}uqax", {"payload", "category", "type", "reporterIDs"}, "",
        {}, [this, budget, limits](sdbus::MethodCall call) {
            auto client = clientFor(call);
            if (!client) {
                return answerNow(call, QVReportingError::limitsExceeded("too many clients"));
            }
            auto decoded = QVReportingReadDictionary(call, budget);
            if (decoded.error) {
                decoded.limit ? QVReportingStats::shared().noteLimitExceeded(*decoded.limit)
                              : QVReportingStats::shared().noteInputRefused();
                return answerNow(call, *decoded.error);
            }
            std::uint32_t category = 0;
            std::uint16_t type = 0;
            std::vector<std::int64_t> ids;
            QVReportingReadRest(call, decoded, category, type, ids);
            if (ids.size() > limits.maxReporterIDsPerMessage) {
                QVReportingStats::shared().noteLimitExceeded(QVReportingStats::Limit::ReporterIDs);
                return answerNow(call, QVReportingError::limitsExceeded(
                                           fmt::format("a message may name at most {} reporter IDs",
                                                       limits.maxReporterIDsPerMessage)));
            }
            const CallID held = hold(std::move(call));
            client->sendMessage(std::move(decoded.dictionary), category, type, std::move(ids),
                                [this, held](const std::optional<QVReportingError>& e) {
                                    answer(held, e, nullptr);
                                });
        });

    registerIDCall(dbus::kStopReportingSession,
                   &QVReportingClientServerInstance::stopReportingSessionForID);
    registerIDCall(dbus::kDestroyReportingSession,
                   &QVReportingClientServerInstance::destroyReportingSession);

    reporting_->registerMethod(
        iface, dbus::kReporterIDValid, "x", {"reporterID"}, "a{sv}", {"reporter"},
        [this](sdbus::MethodCall call) {
            auto client = clientFor(call);
            if (!client) {
                return answerNow(call, QVReportingError::limitsExceeded("too many clients"));
            }
            ReporterID id = 0;
            call >> id;
            const CallID held = hold(std::move(call));
            client->reporterIDValid(
                id, [this, held](const std::optional<QVReportingError>& e, const Dictionary& d) {
                    // The reply's two members have fixed types: x and q.
                    const ReporterID rid =
                        d.find(dbus::kReporterProxyKeyReporterID)->asInt64().value_or(0);
                    const auto type = static_cast<std::uint16_t>(
                        d.find(dbus::kReporterProxyKeyServiceType)->asInt64().value_or(0xFFFF));
                    answer(held, e, [rid, type](sdbus::MethodReply& r) {
                        std::map<std::string, sdbus::Variant> out{
                            {dbus::kReporterProxyKeyReporterID, sdbus::Variant(rid)},
                            {dbus::kReporterProxyKeyServiceType, sdbus::Variant(type)}};
                        r << out;
                    });
                });
        });

    reporting_->registerMethod(
        iface, dbus::kGetAllReporters, "", {}, "ax", {"reporterIDs"},
        [this](sdbus::MethodCall call) {
            auto client = clientFor(call);
            if (!client) {
                return answerNow(call, QVReportingError::limitsExceeded("too many clients"));
            }
            const CallID held = hold(std::move(call));
            client->getAllReporters([this, held](const std::optional<QVReportingError>& e,
                                                 const std::vector<ReporterID>& ids) {
                answer(held, e, [ids](sdbus::MethodReply& r) { r << ids; });
            });
        });

    reporting_->registerMethod(
        iface, dbus::kKillService, "", {}, "b", {"result"}, [this](sdbus::MethodCall call) {
            auto client = clientFor(call);
            if (!client) {
                return answerNow(call, QVReportingError::limitsExceeded("too many clients"));
            }
            client->killService();
        });
}

void QVReportingDBusServer::registerStatsInterface() {
    reporting_->registerMethod(dbus::kStatsInterface, dbus::kGetStats, "", {}, "a{sv}", {"stats"},
                               [this](sdbus::MethodCall call) {
                                   Dictionary stats = QVReportingStats::shared().dump();
                                   stats.set("bus_clients", std::uint64_t{clientCount_.load()});
                                   stats.set("calls_awaiting_reply",
                                             std::uint64_t{pending_.size()});
                                   auto reply = call.createReply();
                                   QVReportingAppendDictionary(reply, stats);
                                   reply.send();
                               });
}

void QVReportingDBusServer::registerNotifyInterface() {
    notify_ = sdbus::createObject(*connection_, dbus::kNotifyObjectPath);
    const std::string iface = dbus::kNotifyInterface;
    notify_->registerMethod(iface, dbus::kPost, "st", {"name", "state"}, "", {},
                            [this](sdbus::MethodCall call) {
                                std::string name;
                                std::uint64_t state = 0;
                                call >> name >> state;
                                notifications_->post(name, state);
                                call.createReply().send();
                            });
    notify_->registerMethod(iface, dbus::kGetState, "s", {"name"}, "t", {"state"},
                            [this](sdbus::MethodCall call) {
                                std::string name;
                                call >> name;
                                auto reply = call.createReply();
                                reply << notifications_->stateOf(name);
                                reply.send();
                            });
    notify_->registerSignal(iface, dbus::kPosted, "st", {"name", "state"});
}

}  // namespace qv
