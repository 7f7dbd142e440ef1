#include "workers/diagnostics/QVReportingSessionIssueFilerWorker.h"

#include "platform/Clock.h"
#include "platform/PreferenceStore.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingSessionWorkerUtility.h"
#include "session/QVReportingUtility.h"

namespace qv {

namespace {

// Where Vidcall spatial-audio reports go in the tracker.
constexpr std::string_view kComponentName = "Vidcall Core - Callwire";
constexpr std::string_view kComponentVersion = "All";
constexpr std::int64_t kComponentIdentifier = 1174093;
// The tracker's "not reproducible at will": the error shows up during a live call.
constexpr std::int32_t kReproducibilityNotOnDemand = 6;
// The tracker's "functional defect".
constexpr std::int32_t kClassificationFunctionalDefect = 7;
constexpr std::string_view kAudioDiagnosticExtension = "com.korvane.DiagnosticExtensions.audio";

}  // namespace

std::shared_ptr<QVReportingSessionIssueFilerWorker>
QVReportingSessionIssueFilerWorker::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    if (!session || !QVReportingUtilityIsInternalBuild(session->platform())) {
        return nullptr;
    }
    const Platform& platform = session->platform();
    const auto backOff = platform.preferences.value(kDefaultsSuite, kBackOffSecondsKey);
    if (!backOff) {
        QVLOG_DEBUG(QVReportingSessionCategory(),
                    "{} default not set. Skipping worker. reporterID={}", kBackOffSecondsKey,
                    session->reporterID());
        return nullptr;
    }
    auto worker = std::make_shared<QVReportingSessionIssueFilerWorker>(
        platform.clock, platform.preferences, platform.issueFiler, backOff->doubleValue());
    worker->setSession(session);
    return worker;
}

bool QVReportingSessionIssueFilerWorker::interestedInMessage(
    const QVReportingSessionMessage& message) {
    const double messageTime = QVReportingSession::getEpochTimeFromQVReportingStateMessage(message);
    if (!(minimumMessageTime_ > 0)) {
        minimumMessageTime_ = messageTime + kGracePeriodSeconds;
    }
    if (!(messageTime > minimumMessageTime_)) {
        return false;
    }
    if (!QVReportingSessionWorkerUtility::isVidcallXYerrorMessage(message)) {
        return false;
    }
    return !hasRunInTimeframe(backOffTime_, kLastRunKey);
}

bool QVReportingSessionIssueFilerWorker::hasRunInTimeframe(double backOffSeconds,
                                                           std::string_view key) {
    const double now = clock_.now();
    const auto last = defaults_.value(kDefaultsSuite, key);
    if (last && last->doubleValue() > now - backOffSeconds) {
        QVLOG_DEBUG(QVReportingSessionCategory(), "Issue filer has run. key={} lastRun={}", key,
                    QVReportingValueText(&*last));
        return true;
    }
    QVLOG_DEBUG(QVReportingSessionCategory(), "Issue filer has not run. key={} backoffSeconds={:f}",
                key, backOffSeconds);
    // The store writes the whole suite back to its file; a failed write is the store's to report,
    // and the answer stands: this session prompts at most once anyway.
    defaults_.setValue(kDefaultsSuite, key, now);
    return false;
}

void QVReportingSessionIssueFilerWorker::handleMessage(
    const std::shared_ptr<QVReportingSessionMessage>& message) {
    if (!message || !interestedInMessage(*message)) {
        return;
    }
    const auto owner = session();
    const ReporterID reporterID = owner ? owner->reporterID() : 0;
    if (hasRun_) {
        QVLOG_DEBUG(QVReportingSessionCategory(),
                    "Issue filer has already run for VidcallXYerrorMessage reporterID={}",
                    reporterID);
        return;
    }
    hasRun_ = true;
    QVLOG_DEFAULT(QVReportingSessionCategory(),
                  "Starting issue filer for VidcallXYerrorMessage reporterID={}", reporterID);
    const std::string processName = owner ? owner->clientProcessName() : std::string();
    issueFiler_.createDraft(
        issueDraftForVidcallXYerror(), processName, kDisplayReason,
        [](const std::optional<std::string>& error) {
            if (error) {
                QVLOG_ERROR(QVReportingSessionCategory(), "Error creating draft - {}", *error);
            } else {
                QVLOG_INFO(QVReportingSessionCategory(), "Successfully created draft");
            }
        });
}

void QVReportingSessionIssueFilerWorker::stop() {
    const auto owner = session();
    QVLOG_DEBUG(QVReportingSessionCategory(), "Resetting hasRun to false. reporterID={}",
                owner ? owner->reporterID() : 0);
    hasRun_ = false;
}

IssueDraft QVReportingSessionIssueFilerWorker::issueDraftForVidcallXYerror() {
    IssueDraft draft;
    draft.title = "Invalid x/y coordinates during a Vidcall call (ITF)";
    draft.problemDescription =
        "Invalid coordinates were provided to the audio layer during a Vidcall call, making it "
        "impossible to render spatial audio correctly. Filing this tracker will help determine "
        "what went wrong.";
    draft.component = {std::string(kComponentName), std::string(kComponentVersion),
                       kComponentIdentifier};
    draft.reproducibility = kReproducibilityNotOnDemand;
    draft.classification = kClassificationFunctionalDefect;
    draft.diagnosticExtensionIdentifiers = {std::string(kAudioDiagnosticExtension)};
    return draft;
}

}  // namespace qv
