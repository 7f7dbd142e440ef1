// Takes a snapshot of the audio drivers' statistics when its session starts and, when the session
// stops, sends the difference into the session as up to three ChannelStats messages (Simple,
// Histogram, State), through the process-wide driver utility (made on the first start).
//
// A producer made at start, not for single-message sessions, with a start and a stop of its own.
//
// Thread safety: lives on the reporting server queue with its session.
#pragma once

#include <memory>
#include <optional>
#include <string_view>

#include "monitoring/QVReportingDriverUtility.h"
#include "session/QVReportingSessionWorker.h"

namespace qv {

class QVReportingSessionDriverSnapshotWorker final
    : public QVReportingSessionWorkerProducerProtocol {
  public:
    static constexpr std::string_view kClassName = "QVReportingSessionDriverSnapshotWorker";

    static std::shared_ptr<QVReportingSessionDriverSnapshotWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    // Stores a snapshot taken now. Returns true.
    bool start() override;
    // Sends the difference from the stored snapshot, then forgets it.
    void stop() override;

    const std::optional<QVReportingDriverUtility::Snapshot>& driverSnapShot() const {
        return driverSnapShot_;
    }

  private:
    std::optional<QVReportingDriverUtility::Snapshot> driverSnapShot_;
};

}  // namespace qv
