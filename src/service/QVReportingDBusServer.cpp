#include "service/QVReportingDBusServer.h"

#include <poll.h>
#include <pthread.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <time.h>
#include <unistd.h>

#include <future>

#include <sdbus-c++/sdbus-c++.h>

#include "QVReportingDBusNames.h"
#include "platform/linux/LinuxNotificationCenter.h"
#include "service/QVReportingDBusCodec.h"
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
    : connection_(std::move(connection)),
      service_(service),
      notifications_(notifications),
      limits_(service.limits()),
      lifeline_(std::make_shared<Lifeline>()) {
    lifeline_->server = this;
    wakeFd_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    if (wakeFd_ < 0) {
        throw sdbus::Error("org.freedesktop.DBus.Error.Failed", "eventfd failed");
    }
}

QVReportingDBusServer::~QVReportingDBusServer() {
    {
        std::lock_guard lock(lifeline_->mutex);
        lifeline_->server = nullptr;
    }
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
        postedWaiting_.store(true, std::memory_order_release);
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
        postedWaiting_.store(false, std::memory_order_relaxed);
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
            if (callBytes_ >= limits_.maxCallBytes) {
                // Past the budget of all clients: leave what the bus sends where it is until the
                // work taken in drains; answers reach this thread through post().
                if (!readsPaused_) {
                    readsPaused_ = true;
                    QVReportingStats::shared().noteBusReadsPaused();
                    QVLOG_ERROR(logCategory(),
                                "calls not yet answered take {} bytes (at most {}): reading the "
                                "bus again when they drain",
                                callBytes_, limits_.maxCallBytes);
                }
                pollfd wake{wakeFd_, POLLIN, 0};
                if (::poll(&wake, 1, -1) < 0 && errno != EINTR) {
                    QVLOG_ERROR(logCategory(), "poll failed: {}", errno);
                }
                drainPosted();
                continue;
            }
            if (readsPaused_) {
                readsPaused_ = false;
                QVLOG_DEFAULT(logCategory(), "reading the bus again");
            }
            while (callBytes_ < limits_.maxCallBytes && connection_->processPendingRequest()) {
                if (stopping_) {
                    return;
                }
                // Answers go out between calls: under a steady stream of calls the loop would
                // otherwise not reach its poll, and every answer would wait for a lull.
                if (postedWaiting_.load(std::memory_order_acquire)) {
                    drainPosted();
                }
            }
            if (callBytes_ >= limits_.maxCallBytes) {
                continue;
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

QVReportingDBusServer::Client* QVReportingDBusServer::admit(sdbus::MethodCall& call, bool held) {
    std::string sender = call.getSender();
    auto it = clients_.find(sender);
    if (it == clients_.end()) {
        // Asking the bus for the peer's PID is a round trip: done once per connection.
        std::int64_t pid = 0;
        try {
            pid = call.getCredsPid();
        } catch (const sdbus::Error& e) {
            QVLOG_ERROR(logCategory(), "no process ID for {}: {}", sender, e.getMessage());
        }
        auto instance = service_.acceptConnection(pid);
        if (!instance) {
            refuse(call, QVReportingError::limitsExceeded("too many clients"));
            return nullptr;
        }
        it = clients_
                 .emplace(
                     std::move(sender),
                     Client{std::move(instance), 0, 0,
                            static_cast<double>(limits_.maxCallBytesPerClient), monotonicMicros()})
                 .first;
        clientCount_ = clients_.size();
    }
    Client& client = it->second;
    const std::uint64_t now = monotonicMicros();
    client.payloadAllowance = std::min(
        static_cast<double>(limits_.maxCallBytesPerClient),
        client.payloadAllowance + static_cast<double>(limits_.maxPayloadBytesPerSecondPerClient) *
                                      static_cast<double>(now - client.allowanceMicros) / 1e6);
    client.allowanceMicros = now;
    // Checked before the arguments are read, so a refusal costs next to nothing.
    std::optional<QVReportingStats::Limit> over;
    std::string why;
    if (held && client.heldCalls >= limits_.maxHeldCallsPerClient) {
        over = QVReportingStats::Limit::HeldCallsPerClient;
        why = fmt::format("a client may have at most {} start calls waiting for their sessions",
                          limits_.maxHeldCallsPerClient);
    } else if (held && heldCalls_ >= limits_.maxHeldCalls) {
        over = QVReportingStats::Limit::HeldCalls;
        why =
            fmt::format("at most {} start calls may wait for their sessions", limits_.maxHeldCalls);
    } else if (client.callBytes >= limits_.maxCallBytesPerClient) {
        over = QVReportingStats::Limit::CallBytesPerClient;
        why = fmt::format("a client's calls not yet answered may take at most {} bytes",
                          limits_.maxCallBytesPerClient);
    } else if (client.payloadAllowance <= 0) {
        over = QVReportingStats::Limit::PayloadRatePerClient;
        why = fmt::format("a client may send at most {} payload bytes a second",
                          limits_.maxPayloadBytesPerSecondPerClient);
    }
    if (over) {
        QVReportingStats::shared().noteLimitExceeded(*over);
        refuse(call, QVReportingError::limitsExceeded(std::move(why)));
        return nullptr;
    }
    return &client;
}

void QVReportingDBusServer::onNameOwnerChanged(sdbus::Message& signal) {
    std::string name, oldOwner, newOwner;
    signal >> name >> oldOwner >> newOwner;
    if (!newOwner.empty()) {
        return;
    }
    // Calls still kept for the departed name can never be answered.
    std::erase_if(pending_, [&](const auto& entry) {
        if (entry.second.sender != name) {
            return false;
        }
        callBytes_ -= entry.second.bytes;
        heldCalls_ -= entry.second.held ? 1 : 0;
        return true;
    });
    noteBudgets();
    auto it = clients_.find(name);
    if (it == clients_.end()) {
        return;
    }
    auto client = std::move(it->second.instance);
    clients_.erase(it);
    clientCount_ = clients_.size();
    QVLOG_DEFAULT(logCategory(), "interruptionHandler: connection exited");
    service_.connectionInvalidated(client);
}

QVReportingDBusServer::Ticket::~Ticket() {
    if (answered) {
        return;
    }
    // No answer will come (the rules give this call none): let it go.
    std::lock_guard lock(lifeline->mutex);
    if (auto* server = lifeline->server) {
        server->post([server, id = id] { server->release(id); });
    }
}

QVReportingDBusServer::TicketPtr QVReportingDBusServer::hold(sdbus::MethodCall call, Client& client,
                                                             std::size_t argumentBytes, bool held) {
    const CallID id = nextCallID_++;
    // A held call waits on its session, not on the queue: it is kept within the count of held
    // calls instead of the bytes of calls in flight.
    const std::size_t bytes = held ? 0 : QVReportingStats::kCallOverheadBytes + argumentBytes;
    client.callBytes += bytes;
    client.heldCalls += held ? 1 : 0;
    callBytes_ += bytes;
    heldCalls_ += held ? 1 : 0;
    std::string sender = call.getSender();
    pending_.emplace(id, Pending{std::move(call), std::move(sender), bytes, held});
    noteBudgets();
    return std::make_shared<Ticket>(lifeline_, id);
}

sdbus::MethodCall QVReportingDBusServer::release(CallID id) {
    auto it = pending_.find(id);
    if (it == pending_.end()) {
        return {};  // the caller left the bus
    }
    Pending pending = std::move(it->second);
    pending_.erase(it);
    callBytes_ -= pending.bytes;
    heldCalls_ -= pending.held ? 1 : 0;
    if (auto c = clients_.find(pending.sender); c != clients_.end()) {
        c->second.callBytes -= pending.bytes;
        c->second.heldCalls -= pending.held ? 1 : 0;
    }
    noteBudgets();
    return std::move(pending.call);
}

void QVReportingDBusServer::chargePayload(Client& client, std::size_t bytes) {
    client.payloadAllowance -= static_cast<double>(bytes);
}

void QVReportingDBusServer::noteBudgets() const {
    QVReportingStats::shared().noteCallBudget(callBytes_, heldCalls_);
}

void QVReportingDBusServer::answer(const TicketPtr& ticket,
                                   const std::optional<QVReportingError>& error,
                                   std::function<void(sdbus::MethodReply&)> fill) {
    ticket->answered = true;
    post([this, id = ticket->id, error, fill = std::move(fill)] {
        sdbus::MethodCall call = release(id);
        if (!call.isValid() || call.doesntExpectReply()) {
            return;
        }
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

void QVReportingDBusServer::refuse(sdbus::MethodCall& call, const QVReportingError& error) {
    if (!call.doesntExpectReply()) {
        call.createErrorReply(toBusError(error)).send();
    }
}

void QVReportingDBusServer::registerReportingInterface() {
    reporting_ = sdbus::createObject(*connection_, dbus::kObjectPath);
    const std::string iface = dbus::kInterface;
    const QVReportingInputBudget budget{limits_.maxPayloadBytes, limits_.maxPayloadValues,
                                        limits_.maxPayloadDepth};

    auto boolReply = [this](TicketPtr ticket) {
        return [this, ticket](const std::optional<QVReportingError>& error, bool result) {
            answer(ticket, error, [result](sdbus::MethodReply& r) { r << result; });
        };
    };
    // Reads a payload or configuration; false (the call refused and counted) when it is not one.
    auto readPayload = [this, budget](sdbus::MethodCall& call, Client& client,
                                      QVReportingDecodeResult& decoded) {
        decoded = QVReportingReadDictionary(call, budget);
        chargePayload(client, decoded.bytes);
        if (!decoded.error) {
            return true;
        }
        decoded.limit ? QVReportingStats::shared().noteLimitExceeded(*decoded.limit)
                      : QVReportingStats::shared().noteInputRefused();
        refuse(call, *decoded.error);
        return false;
    };
    // What a decoded payload costs while its call waits: as received, and as decoded.
    auto payloadBytes = [](const QVReportingDecodeResult& decoded) {
        return decoded.bytes + decoded.dictionary.approximateHeapBytes();
    };
    // Handlers for the methods that take one reporter ID and answer a bool.
    using IDCall = void (QVReportingClientServerInstance::*)(
        ReporterID, QVReportingClientServerInstance::BoolReply);
    auto registerIDCall = [&](const char* member, IDCall op, bool held) {
        reporting_->registerMethod(iface, member, "x", {"reporterID"}, "b", {"result"},
                                   [this, op, held, boolReply](sdbus::MethodCall call) {
                                       Client* client = admit(call, held);
                                       if (!client) {
                                           return;
                                       }
                                       ReporterID id = 0;
                                       call >> id;
                                       auto instance = client->instance;
                                       auto ticket = hold(std::move(call), *client, 0, held);
                                       ((*instance).*op)(id, boolReply(std::move(ticket)));
                                   });
    };

    registerIDCall(dbus::kCreateReportingSession,
                   &QVReportingClientServerInstance::createReportingSession, false);

    reporting_->registerMethod(iface, dbus::kSetServiceType, "qx", {"serviceType", "reporterID"},
                               "b", {"result"}, [this, boolReply](sdbus::MethodCall call) {
                                   Client* client = admit(call);
                                   if (!client) {
                                       return;
                                   }
                                   std::uint16_t type = 0;
                                   ReporterID id = 0;
                                   call >> type >> id;
                                   auto instance = client->instance;
                                   instance->setServiceType(
                                       type, id, boolReply(hold(std::move(call), *client, 0)));
                               });

    reporting_->registerMethod(
        iface, dbus::kGetServiceNameForReporterID, "x", {"reporterID"}, "q", {"serviceType"},
        [this](sdbus::MethodCall call) {
            Client* client = admit(call);
            if (!client) {
                return;
            }
            ReporterID id = 0;
            call >> id;
            auto instance = client->instance;
            auto ticket = hold(std::move(call), *client, 0);
            instance->getServiceNameForReporterID(
                id, [this, ticket](const std::optional<QVReportingError>& e, AudioServiceType t) {
                    answer(ticket, e, [t](sdbus::MethodReply& r) { r << t; });
                });
        });

    reporting_->registerMethod(
        iface, dbus::kSetConfiguration, "a{sv}x", {"configuration", "reporterID"}, "b", {"result"},
        [this, boolReply, readPayload, payloadBytes](sdbus::MethodCall call) {
            Client* client = admit(call);
            QVReportingDecodeResult decoded;
            if (!client || !readPayload(call, *client, decoded)) {
                return;
            }
            ReporterID id = 0;
            QVReportingReadRest(call, decoded, id);
            auto instance = client->instance;
            const std::size_t bytes = payloadBytes(decoded);
            instance->setConfiguration(std::move(decoded.dictionary), id,
                                       boolReply(hold(std::move(call), *client, bytes)));
        });

    registerIDCall(dbus::kStartReportingSession,
                   &QVReportingClientServerInstance::startReportingSessionForID, true);

    reporting_->registerMethod(
        iface, dbus::kSendMessage, "a{sv}uqax", {"payload", "category", "type", "reporterIDs"}, "",
        {}, [this, readPayload, payloadBytes](sdbus::MethodCall call) {
            Client* client = admit(call);
            QVReportingDecodeResult decoded;
            if (!client || !readPayload(call, *client, decoded)) {
                return;
            }
            std::uint32_t category = 0;
            std::uint16_t type = 0;
            std::vector<std::int64_t> ids;
            QVReportingReadRest(call, decoded, category, type, ids);
            if (ids.size() > limits_.maxReporterIDsPerMessage) {
                QVReportingStats::shared().noteLimitExceeded(QVReportingStats::Limit::ReporterIDs);
                return refuse(call, QVReportingError::limitsExceeded(
                                        fmt::format("a message may name at most {} reporter IDs",
                                                    limits_.maxReporterIDsPerMessage)));
            }
            auto instance = client->instance;
            const std::size_t bytes = payloadBytes(decoded) + ids.size() * sizeof(ReporterID);
            auto ticket = hold(std::move(call), *client, bytes);
            instance->sendMessage(std::move(decoded.dictionary), category, type, std::move(ids),
                                  [this, ticket](const std::optional<QVReportingError>& e) {
                                      answer(ticket, e, nullptr);
                                  });
        });

    registerIDCall(dbus::kStopReportingSession,
                   &QVReportingClientServerInstance::stopReportingSessionForID, false);
    registerIDCall(dbus::kDestroyReportingSession,
                   &QVReportingClientServerInstance::destroyReportingSession, false);

    reporting_->registerMethod(
        iface, dbus::kReporterIDValid, "x", {"reporterID"}, "a{sv}", {"reporter"},
        [this](sdbus::MethodCall call) {
            Client* client = admit(call);
            if (!client) {
                return;
            }
            ReporterID id = 0;
            call >> id;
            auto instance = client->instance;
            auto ticket = hold(std::move(call), *client, 0);
            instance->reporterIDValid(
                id, [this, ticket](const std::optional<QVReportingError>& e, const Dictionary& d) {
                    // The reply's two members have fixed types: x and q.
                    const ReporterID rid =
                        d.find(dbus::kReporterProxyKeyReporterID)->asInt64().value_or(0);
                    const auto type = static_cast<std::uint16_t>(
                        d.find(dbus::kReporterProxyKeyServiceType)->asInt64().value_or(0xFFFF));
                    answer(ticket, e, [rid, type](sdbus::MethodReply& r) {
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
            Client* client = admit(call);
            if (!client) {
                return;
            }
            auto instance = client->instance;
            auto ticket = hold(std::move(call), *client, 0);
            instance->getAllReporters([this, ticket](const std::optional<QVReportingError>& e,
                                                     const std::vector<ReporterID>& ids) {
                answer(ticket, e, [ids](sdbus::MethodReply& r) { r << ids; });
            });
        });

    reporting_->registerMethod(iface, dbus::kKillService, "", {}, "b", {"result"},
                               [this](sdbus::MethodCall call) {
                                   if (Client* client = admit(call)) {
                                       client->instance->killService();
                                   }
                               });
}

void QVReportingDBusServer::registerStatsInterface() {
    reporting_->registerMethod(dbus::kStatsInterface, dbus::kGetStats, "", {}, "a{sv}", {"stats"},
                               [this](sdbus::MethodCall call) {
                                   Dictionary stats = QVReportingStats::shared().dump();
                                   stats.set("bus_clients", std::uint64_t{clientCount_.load()});
                                   stats.set("calls_awaiting_reply",
                                             std::uint64_t{pending_.size()});
                                   stats.set("bus_reads_paused_now", readsPaused_);
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
