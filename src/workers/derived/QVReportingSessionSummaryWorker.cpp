#include "workers/derived/QVReportingSessionSummaryWorker.h"

#include <algorithm>
#include <string>

#include "platform/SystemCondition.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingUtility.h"
#include "session/QVReportingVocabulary.h"
#include "workers/derived/QVReportingMessageKeys.h"

namespace qv {

namespace {

std::string_view thermalStateName(ThermalState state) {
    switch (state) {
        case ThermalState::Nominal:
            return "Nominal";
        case ThermalState::Fair:
            return "Fair";
        case ThermalState::Serious:
            return "Serious";
        case ThermalState::Critical:
            return "Critical";
        case ThermalState::Unknown:
            break;
    }
    return "Unknown";
}

}  // namespace

std::shared_ptr<QVReportingSessionSummaryWorker> QVReportingSessionSummaryWorker::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    auto worker = std::make_shared<QVReportingSessionSummaryWorker>();
    worker->setSession(session);
    return worker;
}

void QVReportingSessionSummaryWorker::handleMessage(
    const std::shared_ptr<QVReportingSessionMessage>& message) {
    if (!message) {
        return;
    }
    const Dictionary& payload = message->message();
    // A message that reports active time is counted for that alone.
    if (const Value* duration = payload.find(QVReportingMessageKeySessionDuration)) {
        totalActiveTime_ += duration->doubleValue();
        ++activeCount_;
        return;
    }
    if (const Value* issue = payload.find(QVReportingMessageKeyIssueType)) {
        if (const std::string* text = issue->asString(); text && *text == "overload") {
            ++overloadCount_;
        }
    }
}

Dictionary QVReportingSessionSummaryWorker::summary(const QVReportingSession& session) const {
    const double average =
        activeCount_ == 0 ? 0.0 : totalActiveTime_ / static_cast<double>(activeCount_);
    const auto stored = static_cast<std::uint64_t>(session.messages().size());
    const auto received =
        static_cast<std::uint64_t>(std::max<std::int64_t>(session.totalMessageCount(), 0));
    // Received messages that went unstored for want of budget were not redundant.
    const std::uint64_t notStored = session.messagesNotStored();
    // The session's own state messages are stored without being received: the difference stops
    // at zero rather than wrapping round.
    const std::uint64_t redundant =
        received > stored + notStored ? received - stored - notStored : 0;
    Dictionary payload{
        {"total_active_time", totalActiveTime_},
        {"active_count", std::uint64_t{activeCount_}},
        {"overload_count", std::uint64_t{overloadCount_}},
        {"average_active_time", average},
        {"num_messages", session.totalMessageCount()},
        {"num_unique_messages", stored},
        {"num_redundant_messages", redundant},
        {"singleMessageSession", session.isSingleMessageSession()},
        {"summaryServiceName", session.serviceName()},
        {"HostApplicationDisplayID", QVReportingUtilityRetrieveAppName(session.configuration())},
    };
    if (!session.clientProcessName().empty()) {
        payload.set("clientProcessName", session.clientProcessName());
    }
    const SystemCondition& condition = session.platform().condition;
    payload.set("thermal_state", thermalStateName(condition.thermalState()));
    payload.set("low_power_enabled", condition.lowPowerModeEnabled());
    std::string error;
    if (const auto footprint = condition.ownMemoryFootprint(error)) {
        payload.set("vmInfo_phys_footprint_MiB", *footprint >> 20);
    } else {
        QVLOG_ERROR(QVReportingSummaryLogCategory(), "Error with task_info(): {}", error);
    }
    const auto loads = condition.loadAverages();
    payload.set("load_avg_1_min", loads[0]);
    payload.set("load_avg_5_min", loads[1]);
    payload.set("load_avg_15_min", loads[2]);
    // Only a session that outgrew its store budget says so; others keep the usual keys.
    if (notStored > 0) {
        payload.set("num_messages_not_stored", notStored);
    }
    return payload;
}

void QVReportingSessionSummaryWorker::stop() {
    const auto owner = session();
    if (!owner) {
        return;
    }
    owner->sendMessage(std::make_shared<QVReportingSessionMessage>(
        summary(*owner), category::kPrefixSession | category::kGeneric, type::kSummary));
}

}  // namespace qv
