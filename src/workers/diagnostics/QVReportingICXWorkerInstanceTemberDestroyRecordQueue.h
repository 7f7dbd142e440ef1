// A detector kept in the list for its place: registered in multi-message sessions, interested in
// nothing, never fires.
//
// Thread safety: called on the reporting server queue, like the worker.
#pragma once

#include <memory>
#include <string_view>

#include "session/QVReportingSession.h"
#include "workers/diagnostics/QVReportingICXWorkerInstance.h"

namespace qv {

class QVReportingICXWorkerInstanceTemberDestroyRecordQueue final
    : public QVReportingICXWorkerInstance {
  public:
    static constexpr std::string_view kClassName =
        "QVReportingICXWorkerInstanceTemberDestroyRecordQueue";

    static std::shared_ptr<QVReportingICXWorkerInstanceTemberDestroyRecordQueue> initWithSession(
        const std::shared_ptr<QVReportingSession>& session) {
        if (!session || session->isSingleMessageSession()) {
            return nullptr;
        }
        return std::make_shared<QVReportingICXWorkerInstanceTemberDestroyRecordQueue>(session);
    }

    explicit QVReportingICXWorkerInstanceTemberDestroyRecordQueue(
        const std::shared_ptr<QVReportingSession>& session)
        : QVReportingICXWorkerInstance(session), state_(std::make_shared<WorkerInstanceState>()) {}

    std::string_view className() const override { return kClassName; }
    bool interestedInMessage(const QVReportingSessionMessage&) override { return false; }
    WorkerInstanceState& workerState() override { return *state_; }
    void handleMessage(const std::shared_ptr<QVReportingSessionMessage>&) override {}

  private:
    const std::shared_ptr<WorkerInstanceState> state_;
};

}  // namespace qv
