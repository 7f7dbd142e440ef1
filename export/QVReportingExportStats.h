// The exporter's counters, per sink: nothing sent, refused, resent or lost goes uncounted. The
// exporter has no bus service of its own, so they reach the operator through
// export/status.json, written atomically about once a second and read by
// `qvreportctl fleet status`.
//
// Thread safety: none; the exporter updates and writes them under its lock.
#pragma once

#include <cstdint>
#include <map>
#include <string>

namespace qv::exporter {

struct QVReportingExportSinkCounters {
    std::uint64_t sent = 0;          // publishes, resends included
    std::uint64_t acknowledged = 0;  // acknowledgements, duplicates included
    std::uint64_t duplicates = 0;    // acknowledged as already in the stream (refused by ID)
    std::uint64_t retried = 0;       // lines published again after a failure
    std::uint64_t failed = 0;        // publishes that failed (server error, time-out)
    std::uint64_t expired = 0;       // lines the disk budget removed before they were sent
    // Filled in when the status is written.
    std::uint64_t cursor = 0;   // every line up to here is in the stream (or expired)
    std::uint64_t lastSeq = 0;  // the newest line on disk
    double lagSeconds = 0;      // age of the oldest line not acknowledged
};

struct QVReportingExportStats {
    std::string device;
    std::string stream;
    std::string servers;
    bool connected = false;
    bool streamReady = false;
    std::string lastError;
    double started = 0;  // seconds since 1970
    std::map<std::string, QVReportingExportSinkCounters> sinks;

    // export/status.json: {"device", "stream", "servers", "connected", "stream_ready",
    // "last_error", "started", "updated", "sinks": {NAME: {"sent", "acknowledged",
    // "duplicates", "retried", "failed", "expired", "cursor", "last_seq", "lag_lines",
    // "lag_seconds"}}}
    std::string toJson(double now) const;
};

}  // namespace qv::exporter
