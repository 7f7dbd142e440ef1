// Feeds the energy logging service (EnergyLog) with the haptics engine's activity. Every message
// of type 8 (any category) goes through three handlers, always all three and in this order; each
// decides from the payload keys whether it applies, so one message gives zero to three events,
// logged in registry 28:
//
// | event                              | when the payload has                  | record keys, in
// order
// |------------------------------------|---------------------------------------|-----------------------
// | "Vantrel_Haptics_EngineOnDuration" | "EngineOnTime"                        |
// "EngineOnDuration", "ApplicationName", "TimestampEnd" | "Vantrel_Haptics_ClientStatus"     |
// "EngineState"                         | "Status", "ApplicationName", "TimestampEnd" |
// "LeakedHapticsSessionInfo"         | "Haptic_Active_Hardware_Time_Seconds" |
// "Haptic_Active_Hardware_Time_Seconds", "Active_Clients"
//
// Values are copied as they stand, of whatever kind, except "Status" (1 when "EngineState" is
// the string "EngineOn", else 0). The two handlers that add the application name differ on
// purpose: the engine-on-duration record leaves out a name that is missing or "Unknown" and logs
// it, the client-status record keeps "Unknown" and logs nothing. Only the engine-on-duration
// handler logs a missing timestamp. A key with a null value counts as missing. A session that is
// gone has no application name.
//
// Thread safety: called on the session's queue, like every worker.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "session/QVReportingSessionWorker.h"

namespace qv {

class EnergyLogService;

class QVReportingSessionEnergyLogWorker final : public QVReportingSessionWorkerConsumerProtocol {
  public:
    static constexpr std::string_view kClassName = "QVReportingSessionEnergyLogWorker";
    // The energy log's registry of these events.
    static constexpr std::uint32_t kRegistryID = 28;

    static bool handleSingleMessageSession() { return true; }
    static bool startOnInit() { return true; }

    static std::shared_ptr<QVReportingSessionEnergyLogWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& message) override;

    void handleEngineOnDurationMessage(const QVReportingSessionMessage& message);
    void handleEngineStateMessage(const QVReportingSessionMessage& message);
    void handleLongRunningMessage(const QVReportingSessionMessage& message);

    explicit QVReportingSessionEnergyLogWorker(EnergyLogService& energyLog)
        : energyLog_(energyLog) {}

  private:
    // The client application's name from the session's configuration ("Unknown" when it holds
    // none), or nothing when the session is gone.
    std::optional<std::string> applicationName() const;

    // The platform outlives every session: events still go out should the session be gone.
    EnergyLogService& energyLog_;
};

}  // namespace qv
