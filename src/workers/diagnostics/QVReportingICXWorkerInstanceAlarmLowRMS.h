// Alarm low level: an alarm (or test) session reporting, through its issue detector messages, a
// signal level too low to be heard ("issue_type" "LowRMS"). The third such message of a session
// starts a 60-second timed issue-capture session, once per session; the reporting session cancels
// it when it stops first, so diagnostics are collected only for alarms that keep playing.
// Absent from single-message sessions; its state is the session's own.
//
// Thread safety: called on the reporting server queue, like the worker.
#pragma once

#include <memory>
#include <string_view>

#include "workers/diagnostics/QVReportingICXWorkerInstance.h"

namespace qv {

class QVReportingICXWorkerInstanceAlarmLowRMS final : public QVReportingICXWorkerInstance {
  public:
    static constexpr std::string_view kClassName = "QVReportingICXWorkerInstanceAlarmLowRMS";

    static std::shared_ptr<QVReportingICXWorkerInstanceAlarmLowRMS> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    explicit QVReportingICXWorkerInstanceAlarmLowRMS(
        const std::shared_ptr<QVReportingSession>& session)
        : QVReportingICXWorkerInstance(session), state_(std::make_shared<WorkerInstanceState>()) {}

    std::string_view className() const override { return kClassName; }
    bool interestedInMessage(const QVReportingSessionMessage& message) override;
    WorkerInstanceState& workerState() override { return *state_; }
    bool implementsFire() const override { return true; }
    void fire(const std::shared_ptr<QVReportingSessionMessage>& message) override;
    void stop() override;

    // Duration of the timed issue-capture session, seconds.
    double icxAlarmLowRmsDuration = 0;

  private:
    // Shared with reply callbacks, which may outlive the detector.
    const std::shared_ptr<WorkerInstanceState> state_;
};

}  // namespace qv
