// What one issue capture collects, and where: the journal lines of the processes the request
// names and of the daemon itself over the capture window, and /proc/PID/status of those processes
// that are alive, into the capture's own directory, with a manifest.json that says what was
// collected and what could not be, and why.
//
// The processes: the request payload's "processIDs" (under kIssueCaptureKeyPayloadDEParameters,
// any extension); when it names none, the signature's detected process by name (the journal's
// _COMM, and the live processes whose /proc/PID/comm is that name), unless the name is empty or
// "Unknown".
//
// Every part is bounded: journal lines and bytes by the job's limits, each journal message and
// each status file by fixed caps, the number of processes by kMaxProcesses.
//
// Thread safety: a pure function of its job, apart from the files it reads and writes; callers
// run one capture at a time per directory.
#pragma once

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "values/Value.h"

namespace qv {

struct IssueCaptureJob {
    // At most this many processes are looked at per capture.
    static constexpr std::size_t kMaxProcesses = 32;
    // One journal message is cut after this many bytes.
    static constexpr std::size_t kMaxMessageBytes = 4096;
    // One status file is cut after this many bytes.
    static constexpr std::size_t kMaxStatusBytes = 16384;

    std::string id;
    std::string kind;  // "snapshot" or "session"
    Dictionary signature;
    std::optional<Dictionary> payload;
    double duration = 0;
    double requested = 0;   // seconds since 1970
    double windowFrom = 0;  // journal window, seconds since 1970
    double windowTo = 0;
    std::filesystem::path directory;
    // The journal files to read: a directory, or the local journal when absent.
    std::optional<std::string> journalDirectory;
    std::int64_t daemonPid = 0;
    std::size_t maxJournalLines = 2000;
    std::size_t maxBytes = 1024 * 1024;  // all text the capture writes
};

struct IssueCaptureOutcome {
    nlohmann::ordered_json manifest;
    // Problems worth an error line (directory or file could not be written).
    std::vector<std::string> problems;
    bool manifestWritten = false;
};

// Collects into job.directory (made when missing); completedAt is the manifest's completion time.
IssueCaptureOutcome QVReportingCollectIssueCapture(const IssueCaptureJob& job, double completedAt);

}  // namespace qv
