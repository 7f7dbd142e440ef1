#include "workers/diagnostics/QVReportingICXWorkerInstanceHapticLeaks.h"

#include "platform/IssueCaptureService.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "workers/diagnostics/QVReportingSessionICXWorker.h"

namespace qv {

std::shared_ptr<QVReportingICXWorkerInstanceHapticLeaks>
QVReportingICXWorkerInstanceHapticLeaks::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    if (!session) {
        return nullptr;
    }
    auto state = QVReportingICXSharedStates::stateForClass(kClassName, [](WorkerInstanceState& s) {
        s.interestThresholdCount = 2;
        s.interestThresholdDurationSeconds = 60.0;
        s.oncePerSession = false;
    });
    return std::make_shared<QVReportingICXWorkerInstanceHapticLeaks>(session, std::move(state));
}

bool QVReportingICXWorkerInstanceHapticLeaks::interestedInMessage(
    const QVReportingSessionMessage& message) {
    return message.type() == type::kEnergyLog && message.message().contains(kInterestKey);
}

void QVReportingICXWorkerInstanceHapticLeaks::fire(
    const std::shared_ptr<QVReportingSessionMessage>& message) {
    const auto owner = session();
    if (!owner || !state_->issueReporter) {
        return;
    }
    IssueCaptureReporter& reporter = *state_->issueReporter;
    const Dictionary signature = QVReportingSessionICXWorker::signatureFromMessage(
        *message, service::kHaptics, reporter, "Unknown");
    const Dictionary payload = QVReportingICXSnapshotPayload(owner->processIdentifiers());
    const bool accepted = reporter.snapshotWithSignature(
        signature, 0.0, std::nullopt, payload, [state = state_](const Dictionary& response) {
            std::string identifier =
                QVReportingSessionICXWorker::getSessionIdentifierFromResponse(response);
            state->setCurrentIcxSessionIdentifier(identifier);
            QVLOG_INFO(QVReportingICXLogCategory(),
                       "Started ICX session for haptics leaks. sessionId={} response={}",
                       identifier, response.description());
        });
    if (accepted) {
        QVLOG_INFO(QVReportingICXLogCategory(), "Parameters to ICX session accepted.");
    } else {
        QVLOG_ERROR(QVReportingICXLogCategory(), "Parameters to ICX session not accepted!");
    }
}

}  // namespace qv
