#include "service/QVReportingService.h"

#include <algorithm>
#include <cmath>

#include "platform/AnalyticsService.h"
#include "platform/Clock.h"
#include "platform/ProcessInfo.h"
#include "session/QVReportingLog.h"

namespace qv {

namespace {

// "(a, b, and N more)": at most kMaxSessionsLogged descriptions of total sessions.
std::string describeSessions(const std::vector<std::shared_ptr<QVReportingSession>>& sessions,
                             std::size_t total) {
    std::string out = "(";
    for (std::size_t i = 0; i < sessions.size(); ++i) {
        out += (i ? ", " : "") + sessions[i]->description();
    }
    if (total > sessions.size()) {
        out += fmt::format("{}and {} more", sessions.empty() ? "" : ", ", total - sessions.size());
    }
    return out + ")";
}

}  // namespace

QVReportingService::QVReportingService(const Platform& platform, SerialQueue& queue,
                                       QVReportingLimits limits, TimerFactory timerFactory)
    : platform_(platform), queue_(queue), limits_(limits), timerFactory_(std::move(timerFactory)) {
    // Sessions keep to the store budgets through the process-wide guardrails.
    QVReportingStats::shared().setStoreBudgets(limits_.maxSessionStoreBytes, limits_.maxStoreBytes);
    if (!timerFactory_) {
        timerFactory_ = [](std::chrono::duration<double> interval, std::function<void()> tick) {
            return std::make_unique<RepeatingTimer>(interval, std::move(tick));
        };
    }
}

QVReportingService::~QVReportingService() {
    std::unique_ptr<RepeatingTimer> reaper;
    {
        std::lock_guard lock(lock_);
        reaper = std::move(singleMessageSessionReaper_);
    }
    reaper.reset();
    QVLOG_DEFAULT(QVReportingServiceDelegateCategory(), "destroying service");
}

std::shared_ptr<QVReportingClientServerInstance> QVReportingService::acceptConnection(
    std::int64_t pid) {
    const auto& log = QVReportingServiceDelegateCategory();
    QVLOG_DEFAULT(log, "newConnection: pid={}", pid);
    std::shared_ptr<QVReportingClientServerInstance> client;
    {
        std::lock_guard lock(lock_);
        if (clients_.size() >= limits_.maxClients) {
            QVReportingStats::shared().noteLimitExceeded(QVReportingStats::Limit::Clients);
            QVLOG_ERROR(log, "refusing client {}: {} clients are connected", pid, clients_.size());
            return nullptr;
        }
        client = std::make_shared<QVReportingClientServerInstance>(pid, *this, platform_, queue_,
                                                                   limits_.maxSessionsPerClient);
        // Listed at once, so the limit above counts clients whose setup is still queued.
        clients_.push_back(client);
        QVReportingStats::shared().noteClientCount(clients_.size());
    }
    // On the client's lane, so it comes before the client's first call.
    queue_.async(client->lane(), [this, client] {
        client->setClientStartDate(platform_.clock.now());
        client->setClientProcessName(
            platform_.process.processName(client->processIdentifier()).value_or(""));
    });
    return client;
}

void QVReportingService::connectionInvalidated(
    const std::shared_ptr<QVReportingClientServerInstance>& client) {
    client->handleConnectionError();
    // On the client's lane: after the calls it made before it left.
    queue_.async(client->lane(), [this, client] {
        const auto& log = QVReportingServiceDelegateCategory();
        const std::int64_t pid = client->processIdentifier();
        const std::string name =
            client->clientProcessName().empty() ? "unknown" : client->clientProcessName();
        double uptime = -1;
        if (const auto start = client->clientStartDate()) {
            const double now = platform_.clock.now();
            uptime = std::fabs(now - *start);
            if (*start > now) {
                QVLOG_DEFAULT(log,
                              "clientStartDate is in the past. clientpid={} clientprocessname={}",
                              pid, name);
            }
        } else {
            QVLOG_DEFAULT(log, "clientStartDate is nil. clientpid={} clientprocessname={}", pid,
                          name);
        }
        QVLOG_DEFAULT(log, "invalidationHandler: connection exited process={} uptime_sec={}", name,
                      static_cast<std::int64_t>(uptime));
        if (client->clientProcessName().empty()) {
            QVLOG_DEFAULT(log, "clientProcessName is nil. clientpid={}", pid);
            return;
        }
        if (platform_.analytics.isEventUsed(kClientUptimeEvent)) {
            platform_.analytics.sendEventLazy(
                kClientUptimeEvent, [processName = client->clientProcessName(), uptime] {
                    return Dictionary{{"processName", processName}, {"seconds", uptime}};
                });
        }
    });
}

void QVReportingService::stopAllSessions() {
    queue_.sync([this] {
        std::shared_ptr<QVReportingSession> single;
        {
            std::lock_guard lock(lock_);
            single = std::move(singleMessageSession_);
        }
        for (const auto& client : getAllClients()) {
            client->stopActiveSessions();
        }
        if (single) {
            single->stop();
        }
    });
}

std::vector<std::shared_ptr<QVReportingClientServerInstance>> QVReportingService::getAllClients() {
    std::lock_guard lock(lock_);
    return clients_;
}

std::vector<std::shared_ptr<QVReportingSession>>
QVReportingService::getAllActiveReportingSessions() {
    std::vector<std::shared_ptr<QVReportingSession>> active;
    for (const auto& client : getAllClients()) {
        QVLOG_DEFAULT(
            QVReportingServiceDelegateCategory(), "sessions for client {} : {}",
            client->processIdentifier(),
            describeSessions(client->sessions(kMaxSessionsLogged), client->sessionCount()));
        const auto sessions = client->activeSessions();
        active.insert(active.end(), sessions.begin(), sessions.end());
    }
    return active;
}

std::shared_ptr<QVReportingSession> QVReportingService::findReportingSessionForID(ReporterID id) {
    std::lock_guard lock(lock_);
    if (id == 0 || !reportingEnabled_) {
        return nullptr;
    }
    const auto& log = QVReportingServiceDelegateCategory();
    for (const auto& client : clients_) {
        if (auto session = client->findReportingSessionForID(id, false)) {
            QVLOG_INFO(log, "found reporting session {} for client {}", id,
                       client->processIdentifier());
            return session;
        }
    }
    QVLOG_ERROR(log, "failed to find reporting session {}", id);
    return nullptr;
}

std::vector<std::shared_ptr<QVReportingSession>> QVReportingService::findReportingSessionsForIDs(
    const std::vector<ReporterID>& ids) {
    if (!ids.empty()) {
        std::vector<std::shared_ptr<QVReportingSession>> found;
        for (ReporterID id : ids) {
            if (id == 0) {
                continue;
            }
            if (auto session = findReportingSessionForID(id)) {
                found.push_back(std::move(session));
            }
        }
        return found;
    }
    auto active = getAllActiveReportingSessions();
    logReportingSessions();
    if (!active.empty()) {
        return active;
    }
    return {retrieveSingleMessageSession()};
}

std::shared_ptr<QVReportingSession> QVReportingService::retrieveSingleMessageSession() {
    std::lock_guard lock(lock_);
    if (!singleMessageSession_) {
        QVLOG_DEFAULT(QVReportingServiceDelegateCategory(), "Creating singleMessageSession");
        auto session = QVReportingSession::initWithID(platform_, kSingleMessageReporterID,
                                                      {platform_.process.ownProcessIdentifier()});
        session->setIsSingleMessageSession(true);
        session->setServiceType(service::kStandalone);
        const Dictionary configuration{{"HostApplicationDisplayID", "Unknown"}};
        session->updateConfigurationWithContentsOfConfiguration(&configuration);
        session->start();
        singleMessageSession_ = std::move(session);
        noteSessionCount();
    }
    if (!singleMessageSessionReaper_) {
        // The tick only posts: the session is reaped on the queue, like all session work.
        singleMessageSessionReaper_ =
            timerFactory_(std::chrono::duration<double>(kReaperInterval),
                          [this] { queue_.async([this] { reapSingleMessageSession(); }); });
    }
    singleMessageSessionLastRetrieved_ = platform_.clock.steadyNow();
    return singleMessageSession_;
}

std::shared_ptr<QVReportingSession> QVReportingService::singleMessageSession() {
    std::lock_guard lock(lock_);
    return singleMessageSession_;
}

void QVReportingService::reapSingleMessageSession() {
    std::shared_ptr<QVReportingSession> expired;
    std::unique_ptr<RepeatingTimer> reaper;
    {
        std::lock_guard lock(lock_);
        if (!singleMessageSession_ || !singleMessageSessionLastRetrieved_) {
            return;
        }
        const double elapsed = std::chrono::duration<double>(platform_.clock.steadyNow() -
                                                             *singleMessageSessionLastRetrieved_)
                                   .count();
        if (kSingleMessageSessionTimeout < elapsed) {
            expired = std::move(singleMessageSession_);
            QVLOG_INFO(QVReportingServiceDelegateCategory(),
                       "Stopping singleMessageSession after timeout={:f}",
                       kSingleMessageSessionTimeout);
            reaper = std::move(singleMessageSessionReaper_);
            reaper->invalidate();
        } else {
            QVLOG_DEBUG(QVReportingServiceDelegateCategory(),
                        "Not stopping singleMessageSession. elapsed={:f} timeout={:f}", elapsed,
                        kSingleMessageSessionTimeout);
        }
    }
    reaper.reset();
    if (expired) {
        expired->stop();
        expired.reset();
        noteSessionCount();
    }
}

void QVReportingService::removeClient(
    const std::shared_ptr<QVReportingClientServerInstance>& client) {
    std::lock_guard lock(lock_);
    std::erase(clients_, client);
    QVReportingStats::shared().noteClientCount(clients_.size());
    noteSessionCount();
}

void QVReportingService::logReportingSessions() {
    if (logEnabled(LogLevel::Default)) {
        std::size_t count = 0;
        std::vector<std::shared_ptr<QVReportingSession>> named;
        for (const auto& client : getAllClients()) {
            count += client->activeSessionCount();
            if (named.size() < kMaxSessionsLogged) {
                const auto more = client->activeSessions(kMaxSessionsLogged - named.size());
                named.insert(named.end(), more.begin(), more.end());
            }
        }
        QVLOG_DEFAULT(QVReportingServiceDelegateCategory(), "{} active reporting session(s) {}",
                      count, describeSessions(named, count));
    }
    noteSessionCount();
}

void QVReportingService::noteSessionCount() {
    std::lock_guard lock(lock_);
    std::size_t sessions = singleMessageSession_ ? 1 : 0;
    for (const auto& client : clients_) {
        sessions += client->sessionCount();
    }
    QVReportingStats::shared().noteSessionCount(sessions);
}

}  // namespace qv
