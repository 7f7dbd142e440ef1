// The daemon's side of one client connection: it keeps the client's sessions by reporter ID and
// turns each of the eleven client calls into a task on the reporting server queue, which does the
// work and answers through the call's reply.
//
// Thread safety: the call entry points may be called from any thread (they only capture their
// arguments and post); everything else runs on the reporting server queue.
#pragma once

#include <cstdint>
#include <functional>
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
    // The client's sessions, in the order their IDs were first created.
    std::vector<std::shared_ptr<QVReportingSession>> sessions() const;
    std::vector<ReporterID> reporterIDs() const { return order_; }
    // With acrossAllClients, a miss here is looked up in every client.
    std::shared_ptr<QVReportingSession> findReportingSessionForID(ReporterID id,
                                                                  bool acrossAllClients);

    // How killService ends the process; tests replace it.
    static void setExitHook(std::function<void(int)> hook);

  private:
    void storeSession(ReporterID id, std::shared_ptr<QVReportingSession> session);

    const std::int64_t processIdentifier_;
    QVReportingServiceDelegateProtocol& delegate_;
    const Platform& platform_;
    SerialQueue& queue_;
    const std::size_t maxSessions_;
    std::optional<double> clientStartDate_;
    std::string clientProcessName_;
    std::unordered_map<ReporterID, std::shared_ptr<QVReportingSession>> sessionMap_;
    std::vector<ReporterID> order_;  // the map's keys in creation order
};

}  // namespace qv
