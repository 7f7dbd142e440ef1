// System-sound-server leaks: a system sound reported stuck in energy-log messages. Every counted
// message completes the rule (the state is shared by all sessions), but the snapshot requests of
// the whole process are spaced at least 15 seconds apart, under a lock common to every session;
// a fire inside the spacing requests nothing and still counts as a fire.
//
// Thread safety: called on the reporting server queue, like the worker; fire() runs under the
// class-wide lock.
#pragma once

#include <memory>
#include <string_view>

#include "workers/diagnostics/QVReportingICXWorkerInstance.h"

namespace qv {

class QVReportingICXWorkerInstanceSSSLeaks final : public QVReportingICXWorkerInstance {
  public:
    static constexpr std::string_view kClassName = "QVReportingICXWorkerInstanceSSSLeaks";
    static constexpr std::string_view kInterestKey = "System_Sound_Stuck_Time_Seconds";
    // Least spacing between two snapshot requests of the process.
    static constexpr double kMinimumSecondsBetweenRequests = 15.0;

    static bool handleSingleMessageSession() { return true; }
    static std::shared_ptr<QVReportingICXWorkerInstanceSSSLeaks> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    QVReportingICXWorkerInstanceSSSLeaks(const std::shared_ptr<QVReportingSession>& session,
                                         std::shared_ptr<WorkerInstanceState> state)
        : QVReportingICXWorkerInstance(session), state_(std::move(state)) {}

    std::string_view className() const override { return kClassName; }
    bool interestedInMessage(const QVReportingSessionMessage& message) override;
    WorkerInstanceState& workerState() override { return *state_; }
    bool implementsFire() const override { return true; }
    void fire(const std::shared_ptr<QVReportingSessionMessage>& message) override;

    // For tests only: forgets the time of the last request.
    static void TEST_resetLastRequest();

  private:
    const std::shared_ptr<WorkerInstanceState> state_;
};

}  // namespace qv
