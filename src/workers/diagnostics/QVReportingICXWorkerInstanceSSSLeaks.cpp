#include "workers/diagnostics/QVReportingICXWorkerInstanceSSSLeaks.h"

#include <chrono>
#include <mutex>
#include <optional>

#include "platform/Clock.h"
#include "platform/IssueCaptureService.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "workers/diagnostics/QVReportingSessionICXWorker.h"

namespace qv {

namespace {

// Common to the detectors of every session: the spacing holds for the process.
struct ClassWide {
    std::mutex lock;
    std::optional<std::chrono::steady_clock::time_point> lastRequest;  // guarded by lock
};

ClassWide& classWide() {
    static ClassWide* c = new ClassWide;
    return *c;
}

}  // namespace

std::shared_ptr<QVReportingICXWorkerInstanceSSSLeaks>
QVReportingICXWorkerInstanceSSSLeaks::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    if (!session) {
        return nullptr;
    }
    auto state = QVReportingICXSharedStates::stateForClass(kClassName, [](WorkerInstanceState& s) {
        s.interestThresholdCount = 1;
        s.oncePerSession = false;
    });
    return std::make_shared<QVReportingICXWorkerInstanceSSSLeaks>(session, std::move(state));
}

bool QVReportingICXWorkerInstanceSSSLeaks::interestedInMessage(
    const QVReportingSessionMessage& message) {
    return message.type() == type::kEnergyLog && message.message().contains(kInterestKey);
}

void QVReportingICXWorkerInstanceSSSLeaks::fire(
    const std::shared_ptr<QVReportingSessionMessage>& message) {
    const auto owner = session();
    if (!owner) {
        return;
    }
    ClassWide& shared = classWide();
    std::lock_guard lock(shared.lock);
    const auto now = owner->platform().clock.steadyNow();
    if (shared.lastRequest && std::chrono::duration<double>(now - *shared.lastRequest).count() <
                                  kMinimumSecondsBetweenRequests) {
        QVLOG_INFO(QVReportingICXLogCategory(),
                   "Already fired QVReportingICXWorkerInstanceSSSLeaks recently.");
        return;
    }
    shared.lastRequest = now;
    if (!state_->issueReporter) {
        return;
    }
    IssueCaptureReporter& reporter = *state_->issueReporter;
    const Dictionary signature = QVReportingSessionICXWorker::signatureFromMessage(
        *message, service::kSystemSounds, reporter, "Unknown");
    const Dictionary payload = QVReportingICXSnapshotPayload(owner->processIdentifiers());
    const bool accepted = reporter.snapshotWithSignature(
        signature, 0.0, std::nullopt, payload, [state = state_](const Dictionary& response) {
            std::string identifier =
                QVReportingSessionICXWorker::getSessionIdentifierFromResponse(response);
            state->setCurrentIcxSessionIdentifier(identifier);
            QVLOG_INFO(QVReportingICXLogCategory(),
                       "Started ICX session for system sound server leaks. sessionId={} "
                       "response={}",
                       identifier, response.description());
        });
    if (accepted) {
        QVLOG_INFO(QVReportingICXLogCategory(), "Parameters to ICX session accepted.");
    } else {
        QVLOG_ERROR(QVReportingICXLogCategory(), "Parameters to ICX session not accepted!");
    }
}

void QVReportingICXWorkerInstanceSSSLeaks::TEST_resetLastRequest() {
    ClassWide& shared = classWide();
    std::lock_guard lock(shared.lock);
    shared.lastRequest.reset();
}

}  // namespace qv
