// The daemon's side of one client connection: it keeps the client's sessions by reporter ID and
// turns each of the eleven client calls into a task on the reporting server queue, which does the
// work and answers through the call's reply.
//
// Thread safety: the call entry points may be called from any thread (they only capture their
// arguments and post); everything else runs on the reporting server queue.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/Platform.h"
#include "service/QVReportingError.h"
#include "session/QVReportingSession.h"
#include "session/SerialQueue.h"

namespace qv {

class QVReportingClientServerInstance;

// What a client needs of the service: lookups across clients and its own removal.
class QVReportingServiceDelegateProtocol {
  public:
    virtual ~QVReportingServiceDelegateProtocol() = default;
    virtual std::vector<std::shared_ptr<QVReportingClientServerInstance>> getAllClients() = 0;
    virtual bool isReportingEnabled() = 0;
    virtual std::vector<std::shared_ptr<QVReportingSession>> getAllActiveReportingSessions() = 0;
    virtual std::shared_ptr<QVReportingSession> findReportingSessionForID(ReporterID id) = 0;
    virtual std::vector<std::shared_ptr<QVReportingSession>> findReportingSessionsForIDs(
        const std::vector<ReporterID>& ids) = 0;
    virtual void removeClient(const std::shared_ptr<QVReportingClientServerInstance>& client) = 0;
    virtual void logReportingSessions() = 0;
    // Sessions were created or dropped: the guardrail counters follow.
    virtual void noteSessionCount() = 0;
};

class QVReportingClientServerInstance
    : public std::enable_shared_from_this<QVReportingClientServerInstance> {
  public:
    using BoolReply = std::function<void(const std::optional<QVReportingError>&, bool)>;
    using ServiceTypeReply =
        std::function<void(const std::optional<QVReportingError>&, AudioServiceType)>;
    using ErrorReply = std::function<void(const std::optional<QVReportingError>&)>;
    using DictionaryReply =
        std::function<void(const std::optional<QVReportingError>&, const Dictionary&)>;
    using ReportersReply =
        std::function<void(const std::optional<QVReportingError>&, const std::vector<ReporterID>&)>;

    // initWithPID:delegate:
    QVReportingClientServerInstance(std::int64_t pid, QVReportingServiceDelegateProtocol& delegate,
                                    const Platform& platform, SerialQueue& queue,
                                    std::size_t maxSessions);
    ~QVReportingClientServerInstance();

    QVReportingClientServerInstance(const QVReportingClientServerInstance&) = delete;
    QVReportingClientServerInstance& operator=(const QVReportingClientServerInstance&) = delete;

    // ---- the client's calls ----
    void createReportingSession(ReporterID id, BoolReply reply);
    void setServiceType(AudioServiceType serviceType, ReporterID id, BoolReply reply);
    void getServiceNameForReporterID(ReporterID id, ServiceTypeReply reply);
    void setConfiguration(Dictionary configuration, ReporterID id, BoolReply reply);
    // Answers when the session stops (or at once for an unknown ID); never for a session that is
    // already started.
    void startReportingSessionForID(ReporterID id, BoolReply reply);
    void sendMessage(Dictionary payload, AudioEventCategory category, AudioEventType type,
                     std::vector<ReporterID> ids, ErrorReply reply);
    void stopReportingSessionForID(ReporterID id, BoolReply reply);
    void destroyReportingSession(ReporterID id, BoolReply reply);
    void reporterIDValid(ReporterID id, DictionaryReply reply);
    void getAllReporters(ReportersReply reply);
    // Ends the process at once with status 2 (through the exit hook); never replies.
    void killService();

    // The connection broke: stop the client's sessions and leave the service's list.
    void handleConnectionError();

    // ---- state, read and written on the queue ----
    std::int64_t processIdentifier() const { return processIdentifier_; }
    std::optional<double> clientStartDate() const { return clientStartDate_; }
    void setClientStartDate(double secondsSince1970) { clientStartDate_ = secondsSince1970; }
    const std::string& clientProcessName() const { return clientProcessName_; }
    void setClientProcessName(std::string name) { clientProcessName_ = std::move(name); }
    // The client's sessions, in the order their IDs were first created; at most limit of them.
    std::vector<std::shared_ptr<QVReportingSession>> sessions(std::size_t limit = SIZE_MAX) const;
    // The started ones among them, in the same order.
    std::vector<std::shared_ptr<QVReportingSession>> activeSessions(
        std::size_t limit = SIZE_MAX) const;
    std::vector<ReporterID> reporterIDs() const;
    std::size_t sessionCount() const { return sessionMap_.size(); }
    std::size_t activeSessionCount() const { return started_.size(); }
    // Stops every started session and answers its held start call (a normal shutdown).
    void stopActiveSessions();
    // The lane of the server queue this client's work runs on: the client's calls keep their
    // order, and take turns with other clients' calls.
    const SerialQueue::Lane& lane() const { return lane_; }
    // With acrossAllClients, a miss here is looked up in every client.
    std::shared_ptr<QVReportingSession> findReportingSessionForID(ReporterID id,
                                                                  bool acrossAllClients);

    // How killService ends the process; tests replace it.
    static void setExitHook(std::function<void(int)> hook);

  private:
    struct Entry {
        std::shared_ptr<QVReportingSession> session;
        std::uint64_t order;  // when its ID was first created: the key of order_ and started_
    };

    void storeSession(ReporterID id, std::shared_ptr<QVReportingSession> session);
    // Lists the session among the started ones, or not, as it now is.
    void noteStarted(ReporterID id, const Entry& entry);
    template <typename Keys>
    std::vector<std::shared_ptr<QVReportingSession>> sessionsOf(const Keys& keys,
                                                                std::size_t limit) const;

    const std::int64_t processIdentifier_;
    QVReportingServiceDelegateProtocol& delegate_;
    const Platform& platform_;
    SerialQueue& queue_;
    const SerialQueue::Lane lane_;
    const std::size_t maxSessions_;
    std::optional<double> clientStartDate_;
    std::string clientProcessName_;
    // Every lookup, create, start, stop and destroy costs the same however many sessions are held:
    // the map finds a session, and two ordered indexes keep the creation order of all sessions
    // and of the started ones.
    std::unordered_map<ReporterID, Entry> sessionMap_;
    std::map<std::uint64_t, ReporterID> order_;
    std::map<std::uint64_t, ReporterID> started_;
    std::uint64_t nextOrder_ = 0;
};

}  // namespace qv
