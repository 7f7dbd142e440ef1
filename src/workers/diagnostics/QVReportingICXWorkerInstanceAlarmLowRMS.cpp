#include "workers/diagnostics/QVReportingICXWorkerInstanceAlarmLowRMS.h"

#include "platform/IssueCaptureService.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "workers/diagnostics/QVReportingSessionICXWorker.h"

namespace qv {

std::shared_ptr<QVReportingICXWorkerInstanceAlarmLowRMS>
QVReportingICXWorkerInstanceAlarmLowRMS::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    if (!session || session->isSingleMessageSession()) {
        return nullptr;
    }
    auto detector = std::make_shared<QVReportingICXWorkerInstanceAlarmLowRMS>(session);
    WorkerInstanceState& state = detector->workerState();
    state.interestThresholdDurationSeconds = 15.0;
    state.interestThresholdCount = 3;
    state.oncePerSession = true;
    detector->icxAlarmLowRmsDuration = 60.0;
    return detector;
}

bool QVReportingICXWorkerInstanceAlarmLowRMS::interestedInMessage(
    const QVReportingSessionMessage& message) {
    if (message.category() != category::kError || message.type() != type::kIssueDetector) {
        return false;
    }
    const auto owner = session();
    if (!owner ||
        (owner->serviceType() != service::kAlarms && owner->serviceType() != service::kTest)) {
        return false;
    }
    const Value* issueType = message.message().find("issue_type");
    const std::string* text = issueType ? issueType->asString() : nullptr;
    return text && *text == "LowRMS";
}

void QVReportingICXWorkerInstanceAlarmLowRMS::fire(
    const std::shared_ptr<QVReportingSessionMessage>& message) {
    const auto owner = session();
    if (!owner || !state_->issueReporter) {
        return;
    }
    IssueCaptureReporter& reporter = *state_->issueReporter;
    const Dictionary signature = QVReportingSessionICXWorker::signatureFromMessage(
        *message, owner->serviceType(), reporter, owner->clientProcessName());
    const double duration = icxAlarmLowRmsDuration;
    const bool accepted = reporter.startSessionWithSignature(
        signature, duration, std::nullopt, std::nullopt, std::nullopt,
        [state = state_, duration](const Dictionary& response) {
            std::string identifier =
                QVReportingSessionICXWorker::getSessionIdentifierFromResponse(response);
            state->setCurrentIcxSessionIdentifier(identifier);
            QVLOG_INFO(QVReportingICXLogCategory(),
                       "Started ICX session for alarm Low RMS. sessionId={} timeout={:f} "
                       "response={}",
                       identifier, duration, response.description());
        });
    if (accepted) {
        QVLOG_INFO(QVReportingICXLogCategory(),
                   "Parameters to ICX session for alarm Low RMS accepted. Will fire if not "
                   "cancelled. timeout={:f}.",
                   duration);
    } else {
        QVLOG_ERROR(QVReportingICXLogCategory(), "ICX session for alarm Low RMS failed to start.");
    }
}

void QVReportingICXWorkerInstanceAlarmLowRMS::stop() {
    const auto identifier = state_->currentIcxSessionIdentifier();
    if (!identifier) {
        return;
    }
    QVLOG_INFO(QVReportingICXLogCategory(),
               "Stop called. Cancelling ICX session for alarm Low RMS. sessionId={} timeout={:f}",
               *identifier, icxAlarmLowRmsDuration);
    if (state_->issueReporter) {
        state_->issueReporter->cancelSession(*identifier);
    }
}

}  // namespace qv
