// The reporting service: keeps one client object per connection, answers session lookups across
// clients, and owns the single-message session — a shared session for messages sent without
// reporter IDs while nothing runs, stopped once it has been idle for more than five seconds.
//
// Thread safety: connection bookkeeping and lookups run on the reporting server queue; the
// service's recursive lock guards the client list and the single-message session where they are
// also reached from the transport's thread.
#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <vector>

#include "platform/Platform.h"
#include "service/QVReportingClientServerInstance.h"
#include "session/QVReportingStats.h"
#include "session/RepeatingTimer.h"
#include "session/SerialQueue.h"

namespace qv {

class QVReportingService final : public QVReportingServiceDelegateProtocol {
  public:
    // Makes a repeating timer that calls tick; tests substitute one they fire by hand.
    using TimerFactory = std::function<std::unique_ptr<RepeatingTimer>(
        std::chrono::duration<double> interval, std::function<void()> tick)>;

    QVReportingService(const Platform& platform, SerialQueue& queue, QVReportingLimits limits = {},
                       TimerFactory timerFactory = nullptr);
    ~QVReportingService() override;

    QVReportingService(const QVReportingService&) = delete;
    QVReportingService& operator=(const QVReportingService&) = delete;

    // listener:shouldAcceptNewConnection: — a new client for a connection from pid, or null when
    // the daemon already serves as many clients as it may.
    std::shared_ptr<QVReportingClientServerInstance> acceptConnection(std::int64_t pid);
    // The connection's invalidation: stops the client's sessions and records its uptime.
    void connectionInvalidated(const std::shared_ptr<QVReportingClientServerInstance>& client);

    // Stops every started session of every client and the single-message session, so that their
    // workers flush; for a normal shutdown. Runs on the queue and waits for it.
    void stopAllSessions();

    // ---- QVReportingServiceDelegateProtocol ----
    std::vector<std::shared_ptr<QVReportingClientServerInstance>> getAllClients() override;
    bool isReportingEnabled() override { return reportingEnabled_; }
    std::vector<std::shared_ptr<QVReportingSession>> getAllActiveReportingSessions() override;
    std::shared_ptr<QVReportingSession> findReportingSessionForID(ReporterID id) override;
    std::vector<std::shared_ptr<QVReportingSession>> findReportingSessionsForIDs(
        const std::vector<ReporterID>& ids) override;
    void removeClient(const std::shared_ptr<QVReportingClientServerInstance>& client) override;
    void logReportingSessions() override;
    void noteSessionCount() override;

    void setReportingEnabled(bool enabled) { reportingEnabled_ = enabled; }
    std::shared_ptr<QVReportingSession> singleMessageSession();
    const QVReportingLimits& limits() const { return limits_; }
    // The queue the clients' work runs on.
    SerialQueue& queue() const { return queue_; }
    // Stops and drops the single-message session once it has been idle longer than its timeout.
    void reapSingleMessageSession();

    static constexpr double kSingleMessageSessionTimeout = 5.0;
    static constexpr double kReaperInterval = 0.5;
    static constexpr ReporterID kSingleMessageReporterID = 1;
    static constexpr const char* kClientUptimeEvent = "com.korvane.qvsound.qvreportingclientuptime";
    // Sessions named in one log line of session lists; the rest are counted ("and N more"), so
    // that a line costs the same with 10 sessions or 10^5.
    static constexpr std::size_t kMaxSessionsLogged = 16;

  private:
    std::shared_ptr<QVReportingSession> retrieveSingleMessageSession();

    const Platform& platform_;
    SerialQueue& queue_;
    const QVReportingLimits limits_;
    TimerFactory timerFactory_;
    std::recursive_mutex lock_;
    std::vector<std::shared_ptr<QVReportingClientServerInstance>> clients_;  // guarded by lock_
    std::atomic<bool> reportingEnabled_{true};
    std::shared_ptr<QVReportingSession> singleMessageSession_;    // guarded by lock_
    std::unique_ptr<RepeatingTimer> singleMessageSessionReaper_;  // guarded by lock_
    std::optional<std::chrono::steady_clock::time_point> singleMessageSessionLastRetrieved_;
};

}  // namespace qv
