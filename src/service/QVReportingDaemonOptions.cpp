#include "service/QVReportingDaemonOptions.h"

#include <unistd.h>

#include <CLI/CLI.hpp>
#include <cstdlib>
#include <iostream>
#include <map>

namespace qv {

namespace {

constexpr const char* kVersion = "qvreportd 0.1.0";

}  // namespace

std::string QVReportingDefaultStateDirectory() {
    if (const char* systemd = std::getenv("STATE_DIRECTORY"); systemd && *systemd) {
        std::string dirs = systemd;
        return dirs.substr(0, dirs.find(':'));  // systemd lists several separated by ':'
    }
    if (::geteuid() == 0) {
        return "/var/lib/qvreportd";
    }
    if (const char* xdg = std::getenv("XDG_STATE_HOME"); xdg && *xdg) {
        return std::string(xdg) + "/qvreportd";
    }
    const char* home = std::getenv("HOME");
    return std::string(home && *home ? home : "/tmp") + "/.local/state/qvreportd";
}

std::string QVReportingDefaultDirectSocket() {
    if (const char* runtime = std::getenv("RUNTIME_DIRECTORY"); runtime && *runtime) {
        const std::string dirs = runtime;
        return dirs.substr(0, dirs.find(':')) + "/direct";
    }
    return {};
}

std::optional<QVReportingDaemonOptions> QVReportingParseDaemonOptions(int argc, char** argv,
                                                                      int& exitCode) {
    QVReportingDaemonOptions o;
    CLI::App app{
        "qvreportd: the audio reporting daemon. Clients create reporting sessions over D-Bus "
        "(com.korvane.qvsound.Reporting), send them messages and stop them; the daemon stores, "
        "de-duplicates and forwards them to its sinks under the state directory."};
    app.set_version_flag("--version", kVersion);
    app.add_option("--bus", o.bus,
                   "Bus to serve on: system, session, or a bus address (unix:path=...)")
        ->capture_default_str();
    // --- The direct socket ---
    std::optional<std::string> directSocket;
    app.add_option("--direct-socket", directSocket,
                   "Socket on which clients may connect without the bus (peer-to-peer D-Bus, the "
                   "same interface); \"none\" for none; default: $RUNTIME_DIRECTORY/direct under "
                   "systemd, else none");
    std::string stateDir;
    app.add_option("--state-dir", stateDir,
                   "State directory (defaults/, sinks/, logs/); default: $STATE_DIRECTORY, "
                   "/var/lib/qvreportd for root, else ~/.local/state/qvreportd");
    app.add_option("--device-file", o.deviceFile,
                   "Device description: {\"InternalBuild\": bool, \"capabilities\": {...}}")
        ->capture_default_str();
    bool internalBuild = false;
    app.add_flag("--internal-build", internalBuild,
                 "Behave as on an internal build, whatever the device file says");
    app.add_option("--analytics-events", o.analyticsEventsFile,
                   "File of analytics event names or globs in use (one a line); default: all")
        ->check(CLI::ExistingFile);
    const std::map<std::string, LogLevel> levels{{"debug", LogLevel::Debug},
                                                 {"info", LogLevel::Info},
                                                 {"default", LogLevel::Default},
                                                 {"error", LogLevel::Error}};
    app.add_option("--log-level", o.logLevel, "Lowest level logged: debug, info, default, error")
        ->transform(CLI::CheckedTransformer(levels, CLI::ignore_case));
    auto& l = o.limits;
    app.add_option("--max-payload-bytes", l.maxPayloadBytes,
                   "Largest payload or configuration, in D-Bus bytes")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--max-payload-values", l.maxPayloadValues, "Most values in one payload")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--max-payload-depth", l.maxPayloadDepth, "Deepest nesting of one payload")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--max-reporter-ids", l.maxReporterIDsPerMessage,
                   "Most reporter IDs one message may name")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--max-sessions-per-client", l.maxSessionsPerClient,
                   "Most sessions one client may hold")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--max-clients", l.maxClients, "Most clients served at once")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--max-session-store-bytes", l.maxSessionStoreBytes,
                   "Memory one session's stored messages may take; past it, messages are "
                   "forwarded to the workers but not stored")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--max-store-bytes", l.maxStoreBytes,
                   "Memory the stored messages of all sessions may take together")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--max-call-bytes-per-client", l.maxCallBytesPerClient,
                   "Memory one client's calls may take while not yet answered; past it, its "
                   "further calls are refused with LimitsExceeded")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--max-call-bytes", l.maxCallBytes,
                   "Memory all clients' calls may take while not yet answered; past it, the "
                   "daemon stops reading the bus until they drain")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--max-payload-bytes-per-second", l.maxPayloadBytesPerSecondPerClient,
                   "Payload bytes one client may send a second on average (bursts up to "
                   "--max-call-bytes-per-client); past it, its calls are refused with "
                   "LimitsExceeded")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--max-held-calls-per-client", l.maxHeldCallsPerClient,
                   "Start calls one client may have waiting for their sessions to stop")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--max-held-calls", l.maxHeldCalls,
                   "Start calls all clients may have waiting for their sessions to stop")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--bluez-bus", o.bluezBus,
                   "Bus to read BlueZ (org.bluez) from: system, or a bus address (unix:path=...)")
        ->capture_default_str();
    app.add_option("--accessory-dir", o.accessoryDir,
                   "Directory of accessory information files, one per paired accessory: "
                   "ADDRESS.json (e.g. AA:BB:CC:DD:EE:FF.json)")
        ->capture_default_str();
    app.add_option("--journal-dir", o.journalDir,
                   "Directory of journal files that issue captures read (default: the local "
                   "journal)");
    app.add_option("--tracefs", o.tracefsRoot,
                   "tracefs mount for performance traces; default: /sys/kernel/tracing, else "
                   "/sys/kernel/debug/tracing");
    app.add_option("--sysfs-root", o.sysfsRoot,
                   "Directory standing for / when driver statistics are read from /proc and /sys "
                   "(a fixture tree in tests)")
        ->capture_default_str();
    // --- Files on disk ---
    app.add_option("--sink-segment-bytes", o.sinkSegmentBytes,
                   "Size past which a sink's current file (sinks/NAME.jsonl) is closed as "
                   "sinks/NAME.SEQ.jsonl and a new one begins")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--sink-segment-seconds", o.sinkSegmentSeconds,
                   "Age (from its first line) past which a sink's current file is closed")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--sinks-max-bytes", o.sinksMaxBytes,
                   "Disk the closed sink files of all sinks may take; past it the oldest are "
                   "removed (counted as sink_bytes_expired_SINK)")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--reporting-max-bytes", o.reportingMaxBytes,
                   "Disk the session summary files (logs/Audio/Reporting/) may take; past it the "
                   "oldest are removed")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--spinlogs-max-bytes", o.spinlogsMaxBytes,
                   "Disk the stack samples (logs/Audio/Spinlogs/) may take; past it the oldest "
                   "are removed")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        exitCode = app.exit(e);
        return std::nullopt;
    }
    if (internalBuild) {
        o.internalBuild = true;
    }
    o.directSocket = !directSocket             ? QVReportingDefaultDirectSocket()
                     : *directSocket == "none" ? std::string()
                                               : *directSocket;
    o.stateDir = stateDir.empty() ? QVReportingDefaultStateDirectory() : stateDir;
    exitCode = 0;
    return o;
}

}  // namespace qv
