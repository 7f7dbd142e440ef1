#include "service/QVReportingClientServerInstance.h"

#include <unistd.h>

#include <algorithm>
#include <mutex>
#include <utility>

#include "platform/linux/sinks/JsonlSink.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingStats.h"
#include "session/QVReportingUtility.h"

namespace qv {

namespace {

// How long killService waits for the sinks before the process ends.
constexpr auto kKillFlushTimeout = std::chrono::seconds(1);

std::mutex gExitHookMutex;
std::function<void(int)> gExitHook;  // guarded by gExitHookMutex

std::string describeIDs(const std::vector<ReporterID>& ids) {
    return fmt::format("({})", fmt::join(ids, ", "));
}

// A held start reply may be answered twice (at once for a test session on an internal build,
// and again at stop); the client hears only the first.
QVReportingClientServerInstance::BoolReply once(QVReportingClientServerInstance::BoolReply r) {
    auto pending = std::make_shared<QVReportingClientServerInstance::BoolReply>(std::move(r));
    return [pending](const std::optional<QVReportingError>& error, bool result) {
        if (*pending) {
            auto reply = std::move(*pending);
            *pending = nullptr;
            reply(error, result);
        }
    };
}

// A session that leaves the map (destroyed, or replaced by a create or a new service type)
// answers its held start call with true, as a stop does: left unanswered, the call would stay
// pending until the client leaves the bus, and a connection's pending calls are limited.
void answerHeldStart(QVReportingSession& session) {
    if (auto held = std::move(session.transactionCompleteBlock())) {
        session.setTransactionCompleteBlock(nullptr);
        held(true);
    }
}

}  // namespace

QVReportingClientServerInstance::QVReportingClientServerInstance(
    std::int64_t pid, QVReportingServiceDelegateProtocol& delegate, const Platform& platform,
    SerialQueue& queue, std::size_t maxSessions)
    : processIdentifier_(pid),
      delegate_(delegate),
      platform_(platform),
      queue_(queue),
      lane_(queue.makeLane()),
      maxSessions_(maxSessions) {
    QVLOG_DEFAULT(QVReportingClientCategory(), "new client with pid {}", pid);
}

QVReportingClientServerInstance::~QVReportingClientServerInstance() {
    QVLOG_DEFAULT(QVReportingClientCategory(), "dealloc {} from the server client list",
                  processIdentifier_);
}

void QVReportingClientServerInstance::setExitHook(std::function<void(int)> hook) {
    std::lock_guard lock(gExitHookMutex);
    gExitHook = std::move(hook);
}

template <typename Keys>
std::vector<std::shared_ptr<QVReportingSession>> QVReportingClientServerInstance::sessionsOf(
    const Keys& keys, std::size_t limit) const {
    std::vector<std::shared_ptr<QVReportingSession>> out;
    out.reserve(std::min(limit, keys.size()));
    for (const auto& [order, id] : keys) {
        if (out.size() == limit) {
            break;
        }
        out.push_back(sessionMap_.at(id).session);
    }
    return out;
}

std::vector<std::shared_ptr<QVReportingSession>> QVReportingClientServerInstance::sessions(
    std::size_t limit) const {
    return sessionsOf(order_, limit);
}

std::vector<std::shared_ptr<QVReportingSession>> QVReportingClientServerInstance::activeSessions(
    std::size_t limit) const {
    return sessionsOf(started_, limit);
}

std::vector<ReporterID> QVReportingClientServerInstance::reporterIDs() const {
    std::vector<ReporterID> ids;
    ids.reserve(order_.size());
    for (const auto& [order, id] : order_) {
        ids.push_back(id);
    }
    return ids;
}

std::shared_ptr<QVReportingSession> QVReportingClientServerInstance::findReportingSessionForID(
    ReporterID id, bool acrossAllClients) {
    if (auto it = sessionMap_.find(id); it != sessionMap_.end()) {
        return it->second.session;
    }
    return acrossAllClients ? delegate_.findReportingSessionForID(id) : nullptr;
}

void QVReportingClientServerInstance::noteStarted(ReporterID id, const Entry& entry) {
    if (entry.session->started()) {
        started_.insert_or_assign(entry.order, id);
    } else {
        started_.erase(entry.order);
    }
}

void QVReportingClientServerInstance::storeSession(ReporterID id,
                                                   std::shared_ptr<QVReportingSession> session) {
    session->setClientProcessName(clientProcessName_);
    auto [it, inserted] = sessionMap_.try_emplace(id, Entry{session, nextOrder_});
    if (inserted) {
        order_.emplace(nextOrder_++, id);
    } else {
        const auto replaced = std::exchange(it->second.session, std::move(session));
        answerHeldStart(*replaced);
    }
    noteStarted(id, it->second);
}

void QVReportingClientServerInstance::stopActiveSessions() {
    for (const auto& session : activeSessions()) {
        session->stop();
        answerHeldStart(*session);
    }
    started_.clear();
}

void QVReportingClientServerInstance::createReportingSession(ReporterID id, BoolReply reply) {
    queue_.async(lane_, [self = shared_from_this(), id, reply = std::move(reply)] {
        const auto& log = QVReportingClientCategory();
        QVLOG_DEBUG(log, "creating session for reporter {}", id);
        if (!self->sessionMap_.contains(id) && self->sessionMap_.size() >= self->maxSessions_) {
            QVReportingStats::shared().noteLimitExceeded(
                QVReportingStats::Limit::SessionsPerClient);
            QVLOG_ERROR(log, "refusing session {} for client {}: it holds {} sessions already", id,
                        self->processIdentifier_, self->sessionMap_.size());
            reply(QVReportingError::limitsExceeded(
                      fmt::format("a client may hold at most {} sessions", self->maxSessions_)),
                  false);
            return;
        }
        self->storeSession(
            id, QVReportingSession::initWithID(self->platform_, id, {self->processIdentifier_}));
        QVLOG_DEFAULT(log, "session created for reporter {}", id);
        self->delegate_.noteSessionCount();
        reply(std::nullopt, true);
    });
}

void QVReportingClientServerInstance::setServiceType(AudioServiceType serviceType, ReporterID id,
                                                     BoolReply reply) {
    queue_.async(lane_, [self = shared_from_this(), serviceType, id, reply = std::move(reply)] {
        const auto& log = QVReportingClientCategory();
        QVLOG_DEBUG(log, "setting service type {} for reporter {}", serviceType, id);
        auto session = id != 0 ? self->findReportingSessionForID(id, false) : nullptr;
        if (session) {
            if (session->serviceType() != serviceType) {
                // A new type makes a new session: messages and workers of the old one go with it
                // unstopped; configuration and previous values carry over.
                auto fresh =
                    QVReportingSession::initWithID(self->platform_, id, {self->processIdentifier_});
                fresh->updateConfigurationWithContentsOfConfiguration(&session->configuration());
                fresh->previousValues().merge(session->previousValues());
                fresh->setServiceType(serviceType);
                self->storeSession(id, std::move(fresh));
            } else {
                session->setServiceType(serviceType);
            }
            QVLOG_DEFAULT(log, "service type {} set for reporter  {}", serviceType, id);
        }
        reply(std::nullopt, true);
    });
}

void QVReportingClientServerInstance::getServiceNameForReporterID(ReporterID id,
                                                                  ServiceTypeReply reply) {
    queue_.async(lane_, [self = shared_from_this(), id, reply = std::move(reply)] {
        const auto& log = QVReportingClientCategory();
        QVLOG_DEBUG(log, "fetching seviceType");
        if (id == 0) {
            reply(std::nullopt, service::kUnknown);
            return;
        }
        auto session = self->findReportingSessionForID(id, false);
        const AudioServiceType type = session ? session->serviceType() : service::kUnknown;
        QVLOG_DEFAULT(log, "returning service type {} for reporter  {}", type, id);
        reply(std::nullopt, type);
    });
}

void QVReportingClientServerInstance::setConfiguration(Dictionary configuration, ReporterID id,
                                                       BoolReply reply) {
    queue_.async(lane_, [self = shared_from_this(), configuration = std::move(configuration), id,
                         reply = std::move(reply)] {
        QVLOG_DEBUG(QVReportingClientCategory(), "setting configuration");
        if (auto session = self->findReportingSessionForID(id, false)) {
            session->updateConfigurationWithContentsOfConfiguration(&configuration);
        }
        reply(std::nullopt, true);
    });
}

void QVReportingClientServerInstance::startReportingSessionForID(ReporterID id, BoolReply reply) {
    queue_.async(lane_, [self = shared_from_this(), id, reply = once(std::move(reply))] {
        QVLOG_DEBUG(QVReportingClientCategory(), "starting session for reporter {}", id);
        auto session = id != 0 ? self->findReportingSessionForID(id, false) : nullptr;
        if (!session) {
            reply(std::nullopt, true);
            return;
        }
        if (session->started()) {
            return;  // this call is never answered; the first start's reply is still held
        }
        session->start();
        self->noteStarted(id, self->sessionMap_.at(id));
        answerHeldStart(*session);
        session->setTransactionCompleteBlock([reply](bool result) { reply(std::nullopt, result); });
        if (session->serviceType() == service::kTest &&
            QVReportingUtilityIsInternalBuild(self->platform_)) {
            reply(std::nullopt, true);
        }
        self->delegate_.logReportingSessions();
    });
}

void QVReportingClientServerInstance::sendMessage(Dictionary payload, AudioEventCategory category,
                                                  AudioEventType type, std::vector<ReporterID> ids,
                                                  ErrorReply reply) {
    if (ids.empty() && QVReportingUtilityIsInternalBuild(platform_) &&
        delegate_.isReportingEnabled()) {
        payload.set("sendSingleMessage", 1);
    }
    queue_.async(lane_, [self = shared_from_this(), payload = std::move(payload), category, type,
                         ids = std::move(ids), reply = std::move(reply)]() mutable {
        QVLOG_DEBUG(QVReportingClientCategory(), "sending message for reporter {}",
                    describeIDs(ids));
        if (!self->delegate_.isReportingEnabled()) {
            reply(QVReportingError::reportingDisabled());
            return;
        }
        const auto sessions = self->delegate_.findReportingSessionsForIDs(ids);
        for (std::size_t i = 0; i < sessions.size(); ++i) {
            // Each session gets a message of its own; the last one takes the payload itself.
            sessions[i]->sendMessage(
                i + 1 < sessions.size()
                    ? std::make_shared<QVReportingSessionMessage>(payload, category, type)
                    : std::make_shared<QVReportingSessionMessage>(std::move(payload), category,
                                                                  type));
        }
        reply(std::nullopt);
    });
}

void QVReportingClientServerInstance::stopReportingSessionForID(ReporterID id, BoolReply reply) {
    queue_.async(lane_, [self = shared_from_this(), id, reply = std::move(reply)] {
        const auto& log = QVReportingClientCategory();
        QVLOG_DEBUG(log, "stopping session for reporter {}", id);
        if (id == 0) {
            reply(std::nullopt, true);
            return;
        }
        auto session = self->findReportingSessionForID(id, false);
        if (session && session->started()) {
            session->stop();
            self->noteStarted(id, self->sessionMap_.at(id));
            answerHeldStart(*session);
            self->delegate_.logReportingSessions();
        } else {
            QVLOG_DEFAULT(log,
                          "Stop called, but session==nil or session.started==false. "
                          "reporterID={} session={} session.started={}",
                          id, session ? session->description() : "(null)",
                          session && session->started() ? 1 : 0);
        }
        QVLOG_DEFAULT(log, "stopping {}", id);
        reply(std::nullopt, true);
    });
}

void QVReportingClientServerInstance::destroyReportingSession(ReporterID id, BoolReply reply) {
    queue_.async(lane_, [self = shared_from_this(), id, reply = std::move(reply)] {
        const auto& log = QVReportingClientCategory();
        QVLOG_DEBUG(log, "destroying session for reporter {}", id);
        if (id == 0) {
            reply(std::nullopt, true);
            return;
        }
        if (auto it = self->sessionMap_.find(id); it != self->sessionMap_.end()) {
            auto session = it->second.session;
            if (session->started()) {
                session->stop();
            }
            answerHeldStart(*session);
            self->order_.erase(it->second.order);
            self->started_.erase(it->second.order);
            self->sessionMap_.erase(it);
        }
        QVLOG_DEFAULT(log, "destroying {}", id);
        self->delegate_.logReportingSessions();
        reply(std::nullopt, true);
    });
}

void QVReportingClientServerInstance::reporterIDValid(ReporterID id, DictionaryReply reply) {
    queue_.async(lane_, [self = shared_from_this(), id, reply = std::move(reply)] {
        QVLOG_DEBUG(QVReportingClientCategory(), "validating reporter {}", id);
        Dictionary result{{dbus::kReporterProxyKeyReporterID, std::int64_t{0}},
                          {dbus::kReporterProxyKeyServiceType, std::uint64_t{service::kUnknown}}};
        if (auto session = self->findReportingSessionForID(id, true)) {
            result.set(dbus::kReporterProxyKeyReporterID, id);
            result.set(dbus::kReporterProxyKeyServiceType, std::uint64_t{session->serviceType()});
        }
        reply(std::nullopt, result);
    });
}

void QVReportingClientServerInstance::getAllReporters(ReportersReply reply) {
    queue_.async(lane_, [self = shared_from_this(), reply = std::move(reply)] {
        std::vector<ReporterID> all;
        for (const auto& client : self->delegate_.getAllClients()) {
            const auto ids = client->reporterIDs();
            all.insert(all.end(), ids.begin(), ids.end());
        }
        reply(std::nullopt, all);
    });
}

void QVReportingClientServerInstance::killService() {
    QVLOG_DEFAULT(QVReportingClientCategory(), "DESTROYING SERVICE");
    std::function<void(int)> hook;
    {
        std::lock_guard lock(gExitHookMutex);
        hook = gExitHook;
    }
    if (hook) {
        hook(2);
        return;
    }
    // What the sinks accepted goes to their files first, but a stalled disk does not keep the
    // process alive: the flush is bounded.
    if (!JsonlSink::flushAll(std::chrono::steady_clock::now() + kKillFlushTimeout)) {
        QVLOG_ERROR(
            QVReportingClientCategory(),
            "sinks not flushed within {} ms; exiting with lines unwritten",
            std::chrono::duration_cast<std::chrono::milliseconds>(kKillFlushTimeout).count());
    }
    if (auto sink = logSink()) {
        sink->flush();
    }
    _exit(2);
}

void QVReportingClientServerInstance::handleConnectionError() {
    queue_.async(lane_, [self = shared_from_this()] {
        const auto clients = self->delegate_.getAllClients();
        if (std::find(clients.begin(), clients.end(), self) == clients.end()) {
            return;
        }
        for (const auto& session : self->activeSessions()) {
            session->stop();
        }
        self->sessionMap_.clear();
        self->order_.clear();
        self->started_.clear();
        self->delegate_.removeClient(self);
        QVLOG_DEFAULT(QVReportingClientCategory(), "removing {} from the server client list",
                      self->processIdentifier_);
    });
}

}  // namespace qv
