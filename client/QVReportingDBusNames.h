// The daemon's D-Bus contract: names, paths, interfaces, members and errors. Shared by the daemon
// and its clients (client/ includes nothing else of src/).
#pragma once

namespace qv::dbus {

inline constexpr const char* kBusName = "com.korvane.qvsound.Reporting";
inline constexpr const char* kObjectPath = "/com/korvane/qvsound/Reporting";
inline constexpr const char* kInterface = "com.korvane.qvsound.Reporting";
inline constexpr const char* kStatsInterface = "com.korvane.qvsound.ReportingStats";

inline constexpr const char* kNotifyObjectPath = "/com/korvane/qvsound/Notify";
inline constexpr const char* kNotifyInterface = "com.korvane.qvsound.Notify";

// Methods of kInterface, in their fixed order.
inline constexpr const char* kCreateReportingSession = "CreateReportingSession";  // x -> b
inline constexpr const char* kSetServiceType = "SetServiceType";                  // qx -> b
inline constexpr const char* kGetServiceNameForReporterID =
    "GetServiceNameForReporterID";                                                  // x -> q
inline constexpr const char* kSetConfiguration = "SetConfiguration";                // a{sv}x -> b
inline constexpr const char* kStartReportingSession = "StartReportingSession";      // x -> b (held)
inline constexpr const char* kSendMessage = "SendMessage";                          // a{sv}uqax ->
inline constexpr const char* kStopReportingSession = "StopReportingSession";        // x -> b
inline constexpr const char* kDestroyReportingSession = "DestroyReportingSession";  // x -> b
inline constexpr const char* kReporterIDValid = "ReporterIDValid";                  // x -> a{sv}
inline constexpr const char* kGetAllReporters = "GetAllReporters";                  // -> ax
inline constexpr const char* kKillService = "KillService";                          // -> b (never)

// Method of kStatsInterface.
inline constexpr const char* kGetStats = "GetStats";  // -> a{sv}

// Members of kNotifyInterface.
inline constexpr const char* kPost = "Post";          // st ->
inline constexpr const char* kGetState = "GetState";  // s -> t
inline constexpr const char* kPosted = "Posted";      // signal st

// Keys of the ReporterIDValid reply.
inline constexpr const char* kReporterProxyKeyReporterID = "reporterID";
inline constexpr const char* kReporterProxyKeyServiceType = "serviceType";

// Errors.
inline constexpr const char* kErrorReportingDisabled =
    "com.korvane.audio.reporting.ReportingDisabled";
inline constexpr const char* kErrorLimitsExceeded = "org.freedesktop.DBus.Error.LimitsExceeded";
inline constexpr const char* kErrorInvalidArgs = "org.freedesktop.DBus.Error.InvalidArgs";

}  // namespace qv::dbus
