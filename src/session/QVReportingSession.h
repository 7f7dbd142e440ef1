// One reporting session of one client: identified by its reporter ID, it carries a service type
// and a configuration, stamps and stores the messages it receives, marks those that merely repeat
// the previous state as redundant, and offers each message to its workers.
//
// Invariants: `messages` holds every non-redundant message and the session's own state messages,
// in arrival order (sorted by time only while stopping); the redundancy index maps each
// (category, type) to the newest stored message of that pair.
//
// Thread safety: a session and its workers live on the reporting server queue (or on the one
// thread that owns them in a test); nothing here takes a lock.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/Platform.h"
#include "session/QVReportingSessionMessage.h"
#include "session/QVReportingSessionWorker.h"
#include "session/QVReportingVocabulary.h"
#include "values/Value.h"

namespace qv {

class Clock;

// Payload keys the session reads or writes.
inline constexpr std::string_view QVReportingInternalEventEpochTime = "qvreporting_timestamp";
inline constexpr std::string_view QVReportingMessageKeyQVTimestamp = "qvreporting_timestamp";
inline constexpr std::string_view QVReportingInternalEventProcessUptimeMS = "processuptime_ms";
inline constexpr std::string_view QVReportingInternalEventSystemUptimeSec = "systemuptime_sec";
inline constexpr std::string_view QVReportingMessageKeyInvalidTimestamp = "invalid_timestamp";
inline constexpr std::string_view QVReportingMessageKeyAudioTag = "audiotag";
inline constexpr std::string_view QVReportingApplicationName = "HostApplicationDisplayID";
inline constexpr std::string_view QVReportingMessageKXHostApplicationDisplayID =
    "KXHostApplicationDisplayID";

class QVReportingSession : public std::enable_shared_from_this<QVReportingSession> {
  public:
    using MessageList = std::vector<std::shared_ptr<QVReportingSessionMessage>>;
    using WorkerList = std::vector<std::shared_ptr<QVReportingSessionWorkerProtocol>>;
    using ConsumerList = std::vector<std::shared_ptr<QVReportingSessionWorkerConsumerProtocol>>;
    // Holds the reply of a client's start call; called with true when the session stops.
    using TransactionCompleteBlock = std::function<void(bool)>;
    using Reply = std::function<void()>;

    // Timestamps older than this many seconds are replaced by now.
    static constexpr double kMaximumTimestampAge = 31536000.0;

    // initWithID:processIdentifiers: — creates the session and its start-on-init workers.
    static std::shared_ptr<QVReportingSession> initWithID(
        const Platform& platform, ReporterID reporterID,
        std::vector<std::int64_t> processIdentifiers);
    ~QVReportingSession();

    QVReportingSession(const QVReportingSession&) = delete;
    QVReportingSession& operator=(const QVReportingSession&) = delete;

    const Platform& platform() const { return platform_; }
    ReporterID reporterID() const { return reporterID_; }
    const std::vector<std::int64_t>& processIdentifiers() const { return processIdentifiers_; }
    AudioServiceType serviceType() const { return serviceType_; }
    const std::string& serviceName() const { return serviceName_; }
    void setServiceType(AudioServiceType serviceType);
    const std::string& clientProcessName() const { return clientProcessName_; }
    void setClientProcessName(std::string name) { clientProcessName_ = std::move(name); }
    const Dictionary& configuration() const { return configuration_; }
    bool started() const { return started_; }
    bool isSingleMessageSession() const { return isSingleMessageSession_; }
    void setIsSingleMessageSession(bool single) { isSingleMessageSession_ = single; }
    TransactionCompleteBlock& transactionCompleteBlock() { return transactionCompleteBlock_; }
    void setTransactionCompleteBlock(TransactionCompleteBlock block) {
        transactionCompleteBlock_ = std::move(block);
    }
    const MessageList& messages() const { return messages_; }
    const Dictionary& previousValues() const { return previousValues_; }
    Dictionary& previousValues() { return previousValues_; }
    std::int64_t totalMessageCount() const { return totalMessageCount_; }
    // Messages of this run forwarded to the workers but not stored: the session's or the
    // daemon's store budget was used up (QVReportingLimits).
    std::uint64_t messagesNotStored() const { return messagesNotStored_; }
    // Estimated memory of the stored messages.
    std::size_t storedBytes() const { return storedBytes_; }
    const WorkerList& messageWorkers() const { return messageWorkers_; }
    const ConsumerList& consumingMessageWorkers() const { return consumingMessageWorkers_; }
    const WorkerList& producingMessageWorkers() const { return producingMessageWorkers_; }
    const std::vector<const QVReportingWorkerClass*>& initializedWorkerClasses() const {
        return initializedWorkerClasses_;
    }
    std::size_t workerInstanceCount() const { return messageWorkers_.size(); }

    // Copies "KXHostApplicationDisplayID" to "HostApplicationDisplayID", then merges every entry.
    void updateConfigurationWithContentsOfConfiguration(const Dictionary* configuration);

    void start();
    // Stamps, checks and stores the message and offers it to the consuming workers; then calls
    // reply, if any.
    void sendMessage(const std::shared_ptr<QVReportingSessionMessage>& message,
                     const Reply& reply = {});
    void stop();

    bool messageIsRedundant(const QVReportingSessionMessage& message) const;

    // Creates and starts the workers of the given classes that the session lacks.
    void startWorkersFromClasses(const std::vector<const QVReportingWorkerClass*>& classes);

    std::string description() const;

    static const std::vector<const QVReportingWorkerClass*>& getAllWorkerClasses();
    // The payload's "qvreporting_timestamp" as a double, 0 when absent.
    static double getEpochTimeFromQVReportingStateMessage(const QVReportingSessionMessage& message);
    static void addMissingDates(QVReportingSessionMessage& message, const Clock& clock);
    static void removeWhiteSpaceFromKeys(QVReportingSessionMessage& message);
    static void addAudioMessageTag(QVReportingSessionMessage& message);
    void addAppName(QVReportingSessionMessage& message) const;

  private:
    QVReportingSession(const Platform& platform, ReporterID reporterID,
                       std::vector<std::int64_t> processIdentifiers);

    // Appends to messages_ and keeps the redundancy index current, whatever the budget.
    void storeMessage(std::shared_ptr<QVReportingSessionMessage> message);
    // Stores a received message when the store budgets allow; else counts it.
    void storeIfBudgetAllows(const std::shared_ptr<QVReportingSessionMessage>& message);
    void releaseStore();
    // Merges a payload into previousValues_, within QVReportingStats::kMaxPreviousValuesKeys.
    void rememberPreviousValues(const Dictionary& payload);
    void rebuildNewestIndex();
    std::shared_ptr<QVReportingSessionMessage> makeStateMessage(bool starting) const;
    void offerToConsumers(const std::shared_ptr<QVReportingSessionMessage>& message);

    static std::uint64_t kindKey(AudioEventCategory category, AudioEventType type) {
        return (std::uint64_t{category} << 16) | type;
    }

    const Platform& platform_;
    const ReporterID reporterID_;
    const std::vector<std::int64_t> processIdentifiers_;
    AudioServiceType serviceType_ = service::kUnknown;
    std::string serviceName_ = "unknown";
    std::string clientProcessName_;
    Dictionary configuration_;
    bool started_ = false;
    bool isSingleMessageSession_ = false;
    TransactionCompleteBlock transactionCompleteBlock_;
    MessageList messages_;
    // Newest stored message of each (category, type): the redundancy rule compares with it only.
    std::unordered_map<std::uint64_t, QVReportingSessionMessage*> newestByKind_;
    Dictionary previousValues_;
    std::int64_t totalMessageCount_ = 0;
    std::size_t storedBytes_ = 0;
    std::uint64_t messagesNotStored_ = 0;
    bool warnedPreviousValues_ = false;
    WorkerList messageWorkers_;
    ConsumerList consumingMessageWorkers_;
    WorkerList producingMessageWorkers_;
    std::vector<const QVReportingWorkerClass*> initializedWorkerClasses_;
};

}  // namespace qv
