// The daemon's command line and the state directory it settles on.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "session/QVReportingLog.h"
#include "session/QVReportingStats.h"

namespace qv {

struct QVReportingDaemonOptions {
    std::string bus = "system";  // "system", "session" or a bus address
    // --- The direct socket ---
    // Where clients may connect without the bus; empty: nowhere. Resolved by parsing: the
    // option, else $RUNTIME_DIRECTORY/direct under systemd (RuntimeDirectory=), else none.
    std::string directSocket;
    std::string stateDir;  // resolved: never empty after parsing
    std::string deviceFile = "/etc/qvreportd/device.json";
    std::optional<bool> internalBuild;
    std::string analyticsEventsFile;
    LogLevel logLevel = LogLevel::Info;
    QVReportingLimits limits;
    std::string bluezBus = "system";  // "system" or a bus address: where BlueZ is read
    std::string accessoryDir = "/etc/qvreportd/accessories";
    // Journal files the issue-capture service reads; empty: the local journal.
    std::string journalDir;
    // The tracefs root the trace recorder uses; empty: the first mounted of /sys/kernel/tracing
    // and /sys/kernel/debug/tracing.
    std::string tracefsRoot;
    // The directory that stands for "/" when kernel counters are read (driver statistics).
    std::string sysfsRoot = "/";

    // --- Files on disk ---
    // A sink's current segment is closed past this size or this age (from its first line).
    std::uint64_t sinkSegmentBytes = std::uint64_t{64} << 20;
    double sinkSegmentSeconds = 86400;
    // The closed segments of all sinks together; past it the oldest are removed.
    std::uint64_t sinksMaxBytes = std::uint64_t{1} << 30;
    // Session summary files (logs/Audio/Reporting/) and stack samples (logs/Audio/Spinlogs/).
    std::uint64_t reportingMaxBytes = std::uint64_t{256} << 20;
    std::uint64_t spinlogsMaxBytes = std::uint64_t{512} << 20;
};

// Parses argv. Returns the options, or nothing after printing help, the version or an error;
// exitCode then says how to leave (0 for help and version).
std::optional<QVReportingDaemonOptions> QVReportingParseDaemonOptions(int argc, char** argv,
                                                                      int& exitCode);

// --state-dir, else $STATE_DIRECTORY (the first of its list), else /var/lib/qvreportd for root,
// else $XDG_STATE_HOME/qvreportd, else ~/.local/state/qvreportd.
std::string QVReportingDefaultStateDirectory();

// The direct socket when no option names one: $RUNTIME_DIRECTORY/direct (the first of its
// list), else none (empty): a daemon started by hand serves the bus only unless asked.
std::string QVReportingDefaultDirectSocket();

}  // namespace qv
