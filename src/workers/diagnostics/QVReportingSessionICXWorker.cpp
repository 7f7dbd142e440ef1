#include "workers/diagnostics/QVReportingSessionICXWorker.h"

#include <fmt/format.h>

#include "platform/Clock.h"
#include "platform/DeviceInformation.h"
#include "platform/IssueCaptureService.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingUtility.h"
#include "session/QVReportingVocabulary.h"
#include "workers/diagnostics/QVReportingICXWorkerInstanceAlarmLowRMS.h"
#include "workers/diagnostics/QVReportingICXWorkerInstanceHapticLeaks.h"
#include "workers/diagnostics/QVReportingICXWorkerInstanceSSSLeaks.h"
#include "workers/diagnostics/QVReportingICXWorkerInstanceTemberDestroyRecordQueue.h"

namespace qv {

namespace {

constexpr std::string_view kTestModeLine = "Skipping actual fire, as we are running in test mode.";

}  // namespace

Dictionary QVReportingICXSnapshotPayload(const std::vector<std::int64_t>& processIdentifiers) {
    // Built with set() and moves rather than initializer lists, which copy every entry: a flood
    // builds one payload per fire.
    Array pids;
    pids.reserve(processIdentifiers.size());
    for (const std::int64_t pid : processIdentifiers) {
        pids.emplace_back(pid);
    }
    Dictionary filter;
    filter.set("processIDs", Value(std::move(pids)));
    Dictionary extensions;
    extensions.set("com.korvane.EnergylogCore.DESysLogFilterProcess", Value(std::move(filter)));
    Dictionary payload;
    payload.set(kIssueCaptureKeyPayloadDEParameters, Value(std::move(extensions)));
    return payload;
}

std::shared_ptr<QVReportingSessionICXWorker> QVReportingSessionICXWorker::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    if (!session || !QVReportingUtilityIsInternalBuild(session->platform())) {
        return nullptr;
    }
    auto worker = std::make_shared<QVReportingSessionICXWorker>();
    worker->setSession(session);
    worker->setStarted(false);
    if (session->platform().device.hasCapability(
            QVReportingICXWorkerInstanceHapticLeaks::kCapability)) {
        worker->addInstance<QVReportingICXWorkerInstanceHapticLeaks>();
    }
    worker->addInstance<QVReportingICXWorkerInstanceAlarmLowRMS>();
    worker->addInstance<QVReportingICXWorkerInstanceTemberDestroyRecordQueue>();
    worker->addInstance<QVReportingICXWorkerInstanceSSSLeaks>();
    return worker;
}

bool QVReportingSessionICXWorker::start() {
    setStarted(true);
    for (const auto& instance : instances_) {
        instance->start();
    }
    return started();
}

void QVReportingSessionICXWorker::stop() {
    for (const auto& instance : instances_) {
        instance->stop();
    }
    setStarted(false);
}

void QVReportingSessionICXWorker::handleMessage(
    const std::shared_ptr<QVReportingSessionMessage>& message) {
    if (!message) {
        return;
    }
    const auto owner = session();
    if (!owner) {
        return;
    }
    const Clock& clock = owner->platform().clock;
    const Dictionary& payload = message->message();
    for (const auto& instance : instances_) {
        WorkerInstanceState& state = instance->workerState();
        if (state.lastMessage && *state.lastMessage == payload) {
            continue;
        }
        if (!instance->interestedInMessage(*message)) {
            continue;
        }
        QVLOG_DEBUG(QVReportingICXLogCategory(), "Interested in message. instance={}, {}",
                    instance->className(), message->description());
        ++state.interestedCount;
        if (!state.interestFirstSeen) {
            state.interestFirstSeen = clock.now();
        }
        instance->handleMessage(message);
        state.lastMessage = payload;
        if (!instance->implementsFire()) {
            continue;
        }
        if (state.interestedCount < state.interestThresholdCount) {
            continue;
        }
        if (state.interestThresholdCount == 0) {
            const double elapsed = clock.now() - *state.interestFirstSeen;
            // Not greater also covers a NaN elapsed time: no fire on a time that cannot be read.
            if (!(elapsed > state.interestThresholdDurationSeconds)) {
                continue;
            }
        }
        if (state.firedCount != 0 && state.oncePerSession) {
            continue;
        }
        state.issueReporter = owner->platform().issueCapture.createReporter();
        ++state.firedCount;
        if (owner->serviceType() == service::kTest) {
            QVLOG_INFO(QVReportingICXLogCategory(), "{}", kTestModeLine);
        } else {
            instance->fire(message);
        }
        state.lastMessage.reset();
        state.interestFirstSeen.reset();
        state.interestedCount = 0;
    }
}

std::string QVReportingSessionICXWorker::getSessionIdentifierFromResponse(
    const Dictionary& response) {
    const Value* success = response.find(kIssueCaptureReplySuccess);
    if (success && *success == Value(true)) {
        if (const Value* identifier = response.find(kIssueCaptureReplySessionID)) {
            std::string text = QVReportingValueText(identifier);
            QVLOG_INFO(QVReportingICXLogCategory(), "Started ICX session. sessionId={}", text);
            return text;
        }
        QVLOG_ERROR(QVReportingICXLogCategory(), "Started ICX session, but no sessionId found!");
        return std::string(kNoneReturned);
    }
    std::int64_t reason = 0;
    if (const Value* given = response.find(kIssueCaptureReplyReason)) {
        reason = given->asInt64().value_or(0);
    } else {
        QVLOG_ERROR(QVReportingICXLogCategory(), "Failed starting icx session. Unknown reason.");
    }
    if (reason == kIssueCaptureErrorNone) {
        QVLOG_ERROR(QVReportingICXLogCategory(),
                    "Failed starting icx session. reason=kIssueCaptureErrorNone");
    } else if (const auto name = IssueCaptureErrorName(reason)) {
        QVLOG_INFO(QVReportingICXLogCategory(), "Failed starting icx session. reason={}", *name);
    } else {
        QVLOG_INFO(QVReportingICXLogCategory(), "Failed starting icx session. reason={}", reason);
    }
    return std::string(kNoneReturned);
}

Dictionary QVReportingSessionICXWorker::signatureFromMessage(
    const QVReportingSessionMessage& message, AudioServiceType serviceType,
    IssueCaptureReporter& issueReporter, std::string_view clientProcessName) {
    return issueReporter.makeSignature(
        "AudioAnalytics", QVReportingUtilityGenerateServiceNameFromServiceType(serviceType),
        QVReportingUtilityCategoryString(message.category()),
        QVReportingUtilityTypeString(message.type()), clientProcessName, std::nullopt);
}

}  // namespace qv
