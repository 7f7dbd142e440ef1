// Sends the device's feature states (see QVReportingSystemMonitor) into its session: the current
// state of every feature when the session starts, and each new state while it runs, as Setup /
// Setup messages whose "last_updated" says when the state was read.
//
// A producer that is made at start, not for single-message sessions, with a start and a stop of
// its own. It applies only when the process has a system monitor.
//
// Thread safety: lives on the reporting server queue with its session; the monitor's changes
// reach it on that queue too.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "monitoring/QVReportingObservedDictionary.h"
#include "session/QVReportingSessionWorker.h"

namespace qv {

inline constexpr std::string_view QVReportingMessageKeyLastUpdated = "last_updated";

class QVReportingSessionSystemMonitorWorker final
    : public QVReportingSessionWorkerProducerProtocol,
      public std::enable_shared_from_this<QVReportingSessionSystemMonitorWorker> {
  public:
    static constexpr std::string_view kClassName = "QVReportingSessionSystemMonitorWorker";

    // Null when the process has no system monitor.
    static std::shared_ptr<QVReportingSessionSystemMonitorWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);
    ~QVReportingSessionSystemMonitorWorker() override;

    // Sends every feature's current state, then observes each feature. Returns true.
    bool start() override;
    // Stops observing.
    void stop() override;

    // Sends the message made from state, if any, into the session.
    void handleChange(const std::optional<Dictionary>& state);
    // The Setup / Setup message of a feature state: the read time moves from
    // "qvreporting_timestamp" to "last_updated" and "systemuptime_sec" goes. Null when there is
    // nothing to send.
    static std::shared_ptr<QVReportingSessionMessage> messageForState(
        const std::optional<Dictionary>& state);

    const std::vector<std::string>& featureKeys() const { return featureKeys_; }

  private:
    void removeObservers();

    std::shared_ptr<QVReportingObservedDictionary> systemMonitorDictionary_;
    std::vector<std::string> featureKeys_;
    std::vector<QVReportingObservedDictionary::ObserverID> observers_;
};

}  // namespace qv
