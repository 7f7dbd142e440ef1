// Haptic leaks: haptic hardware reported active in energy-log messages. Every second such message
// counted in the process (the state is shared by all sessions) asks the issue-capture service for
// a snapshot of the session's client processes. Registered only on devices with haptic hardware,
// which the device declares with the capability "haptics" (device file: "capabilities":
// {"haptics": true}).
//
// Thread safety: called on the reporting server queue, like the worker.
#pragma once

#include <memory>
#include <string_view>

#include "workers/diagnostics/QVReportingICXWorkerInstance.h"

namespace qv {

class QVReportingICXWorkerInstanceHapticLeaks final : public QVReportingICXWorkerInstance {
  public:
    static constexpr std::string_view kClassName = "QVReportingICXWorkerInstanceHapticLeaks";
    // The device capability that gates the detector.
    static constexpr std::string_view kCapability = "haptics";
    static constexpr std::string_view kInterestKey = "Haptic_Active_Hardware_Time_Seconds";

    static bool handleSingleMessageSession() { return true; }
    static std::shared_ptr<QVReportingICXWorkerInstanceHapticLeaks> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    QVReportingICXWorkerInstanceHapticLeaks(const std::shared_ptr<QVReportingSession>& session,
                                            std::shared_ptr<WorkerInstanceState> state)
        : QVReportingICXWorkerInstance(session), state_(std::move(state)) {}

    std::string_view className() const override { return kClassName; }
    bool interestedInMessage(const QVReportingSessionMessage& message) override;
    WorkerInstanceState& workerState() override { return *state_; }
    bool implementsFire() const override { return true; }
    void fire(const std::shared_ptr<QVReportingSessionMessage>& message) override;

  private:
    const std::shared_ptr<WorkerInstanceState> state_;
};

}  // namespace qv
