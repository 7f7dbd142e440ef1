// Counts a session's activity while it runs and, when it stops, sends one summary message back
// into the session: active time and count, overloads, messages received and how many were
// redundant, and the device's condition at that moment (thermal state, low-power mode, this
// daemon's memory footprint, load averages).
//
// Thread safety: called on the session's queue, like every worker; the counters need no lock.
#pragma once

#include <cstdint>
#include <memory>
#include <string_view>

#include "session/QVReportingSessionWorker.h"
#include "values/Value.h"

namespace qv {

class QVReportingSessionSummaryWorker final : public QVReportingSessionWorkerProducerProtocol,
                                              public QVReportingSessionWorkerConsumerProtocol {
  public:
    static constexpr std::string_view kClassName = "QVReportingSessionSummaryWorker";

    static std::shared_ptr<QVReportingSessionSummaryWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    bool start() override { return true; }
    void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& message) override;
    // Sends the summary, whether or not start was called.
    void stop() override;

    double totalActiveTime() const { return totalActiveTime_; }
    std::uint32_t activeCount() const { return activeCount_; }
    std::uint32_t overloadCount() const { return overloadCount_; }
    // Declared for clients of the class but never counted: the summary takes both figures from
    // the session.
    std::uint32_t numUniqueMessages() const { return 0; }
    std::uint32_t numRedundantMessages() const { return 0; }

  private:
    // The summary's payload as it would be sent now.
    Dictionary summary(const QVReportingSession& session) const;

    double totalActiveTime_ = 0.0;
    std::uint32_t activeCount_ = 0;
    std::uint32_t overloadCount_ = 0;
};

}  // namespace qv
