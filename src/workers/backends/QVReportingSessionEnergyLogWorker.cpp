#include "workers/backends/QVReportingSessionEnergyLogWorker.h"

#include "platform/EnergyLogService.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingUtility.h"

namespace qv {

namespace {

constexpr std::string_view kEngineOnDurationEvent = "Vantrel_Haptics_EngineOnDuration";
constexpr std::string_view kClientStatusEvent = "Vantrel_Haptics_ClientStatus";
constexpr std::string_view kLeakedSessionEvent = "LeakedHapticsSessionInfo";

constexpr std::string_view kEngineOnTimeKey = "EngineOnTime";
constexpr std::string_view kEngineStateKey = "EngineState";
constexpr std::string_view kHardwareTimeKey = "Haptic_Active_Hardware_Time_Seconds";
constexpr std::string_view kActiveClientsKey = "Active_Clients";

constexpr std::string_view kEngineOnDurationRecordKey = "EngineOnDuration";
constexpr std::string_view kStatusRecordKey = "Status";
constexpr std::string_view kApplicationNameRecordKey = "ApplicationName";
constexpr std::string_view kTimestampEndRecordKey = "TimestampEnd";

constexpr std::string_view kEngineOn = "EngineOn";
constexpr std::string_view kUnknownApplication = "Unknown";

// The value under key, or null when it is absent or null.
const Value* presentValue(const Dictionary& payload, std::string_view key) {
    const Value* value = payload.find(key);
    return value != nullptr && !value->isNull() ? value : nullptr;
}

}  // namespace

std::shared_ptr<QVReportingSessionEnergyLogWorker>
QVReportingSessionEnergyLogWorker::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    if (!session) {
        return nullptr;
    }
    auto worker =
        std::make_shared<QVReportingSessionEnergyLogWorker>(session->platform().energyLog);
    worker->setSession(session);
    return worker;
}

std::optional<std::string> QVReportingSessionEnergyLogWorker::applicationName() const {
    const auto owner = session();
    if (!owner) {
        return std::nullopt;
    }
    return QVReportingUtilityRetrieveAppName(owner->configuration());
}

void QVReportingSessionEnergyLogWorker::handleMessage(
    const std::shared_ptr<QVReportingSessionMessage>& message) {
    if (!message || message->type() != type::kEnergyLog) {
        return;
    }
    handleEngineOnDurationMessage(*message);
    handleEngineStateMessage(*message);
    handleLongRunningMessage(*message);
}

void QVReportingSessionEnergyLogWorker::handleEngineOnDurationMessage(
    const QVReportingSessionMessage& message) {
    const Dictionary& payload = message.message();
    const Value* onTime = presentValue(payload, kEngineOnTimeKey);
    if (onTime == nullptr) {
        return;
    }
    Dictionary record;
    record.reserve(3);
    record.set(kEngineOnDurationRecordKey, *onTime);
    const auto name = applicationName();
    if (name && *name != kUnknownApplication) {
        record.set(kApplicationNameRecordKey, *name);
    } else {
        QVLOG_ERROR(QVReportingEnergyLogCategory(), "failed to get app name for energylog");
    }
    if (const Value* timestamp = presentValue(payload, QVReportingMessageKeyQVTimestamp)) {
        record.set(kTimestampEndRecordKey, *timestamp);
    } else {
        QVLOG_ERROR(QVReportingEnergyLogCategory(),
                    "failed to get QVReporting timestamp for energylog");
    }
    energyLog_.logRegisteredEvent(kRegistryID, kEngineOnDurationEvent, record, nullptr);
}

void QVReportingSessionEnergyLogWorker::handleEngineStateMessage(
    const QVReportingSessionMessage& message) {
    const Dictionary& payload = message.message();
    const Value* state = presentValue(payload, kEngineStateKey);
    if (state == nullptr) {
        return;
    }
    Dictionary record;
    record.reserve(3);
    const std::string* text = state->asString();
    record.set(kStatusRecordKey, text != nullptr && *text == kEngineOn ? 1 : 0);
    // Unlike the engine-on-duration record, "Unknown" is kept here and a missing name is not
    // logged.
    if (const auto name = applicationName()) {
        record.set(kApplicationNameRecordKey, *name);
    }
    if (const Value* timestamp = presentValue(payload, QVReportingMessageKeyQVTimestamp)) {
        record.set(kTimestampEndRecordKey, *timestamp);
    }
    energyLog_.logRegisteredEvent(kRegistryID, kClientStatusEvent, record, nullptr);
}

void QVReportingSessionEnergyLogWorker::handleLongRunningMessage(
    const QVReportingSessionMessage& message) {
    const Dictionary& payload = message.message();
    const Value* hardwareTime = presentValue(payload, kHardwareTimeKey);
    if (hardwareTime == nullptr) {
        return;
    }
    Dictionary record;
    record.reserve(2);
    record.set(kHardwareTimeKey, *hardwareTime);
    if (const Value* clients = presentValue(payload, kActiveClientsKey)) {
        record.set(kActiveClientsKey, *clients);
    }
    energyLog_.logRegisteredEvent(kRegistryID, kLeakedSessionEvent, record, nullptr);
}

}  // namespace qv
