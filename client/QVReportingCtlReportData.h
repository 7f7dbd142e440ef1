// What `qvreportctl report` shows, gathered from a state directory's sinks (each read across its
// segments, oldest first): the sessions (from the conversation-quality mirror, which names each
// session, its application and its service and holds every message, derived ones included), the
// playback and record time and the volume stretches (from the analytics sink's derived Volume and
// Input summaries), the issues (MTX records, overloads, captures, stack samples, bug report
// drafts) and what each sink file holds on disk.
//
// Times are the sinks' own "time" (seconds since 1970, when the daemon wrote the line); a range
// keeps what lies in [since, until).
//
// Thread safety: pure functions (apart from reading files).
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace qv::client {

struct ReportFilter {
    std::optional<double> since;
    std::optional<double> until;  // exclusive
    std::string application;      // empty: every one
    bool contains(double time) const;
};

struct ReportSession {
    std::int64_t reporterID = 0;
    std::string application;   // "KXHostApplicationDisplayID" of its configuration, else empty
    std::string service;       // "longformaudio"
    double start = 0;          // its "session" line
    double end = 0;            // its "flush" line, else its last message
    bool stopped = false;      // flushed
    std::size_t messages = 0;  // sent by the client
    // Messages the daemon derived at stop, by what they are ("volume stretch", "summary", ...).
    std::map<std::string, std::size_t> derived;
    // Messages that reported an issue, by "issue_type", and the captures it caused.
    std::map<std::string, std::size_t> issues;
    std::size_t captures = 0;
};

// Seconds of playback and of recording: one application on one device.
struct ReportUsage {
    double playSeconds = 0;
    double recordSeconds = 0;
};

// One playback as the Volume summaries cut it: a stretch per volume, device or format.
struct ReportPlayback {
    std::string application;
    double time = 0;  // when its summaries were written: the session's stop
    struct Stretch {
        double seconds = 0;
        double volume = 0;
        std::string device;
    };
    std::vector<Stretch> stretches;
};

struct ReportIssue {
    enum class Kind { kMTXRecord, kOverload, kCapture, kStackSample, kBugReport };
    Kind kind;
    double time = 0;
    std::string application;  // empty when the line names none
    std::string detail;       // "silence on node 12", "haptics / Playback", ...
};
std::string_view QVReportingCtlIssueKindName(ReportIssue::Kind kind);
inline constexpr int kReportIssueKinds = 5;

// One sink as it lies on disk.
struct ReportSinkFiles {
    std::size_t segments = 0;
    std::uint64_t bytes = 0;
    std::uint64_t lines = 0;
    std::uint64_t firstSeq = 0;
    std::uint64_t lastSeq = 0;
    // Lines whose seq is missing before the first line and between lines: removed by the disk
    // budget before anyone read them.
    std::uint64_t linesMissing = 0;
    std::uint64_t linesUnreadable = 0;  // not a JSON object with a numeric "time"
};

struct ReportData {
    ReportFilter filter;
    std::vector<ReportSession> sessions;  // by start
    // application -> device -> time
    std::map<std::string, std::map<std::string, ReportUsage>> usage;
    std::vector<ReportPlayback> playbacks;  // by time
    std::vector<ReportIssue> issues;        // by time
    std::map<std::string, ReportSinkFiles> sinks;
    // The first and last time of anything shown, 0 when nothing is.
    double first = 0;
    double last = 0;

    bool empty() const {
        return sessions.empty() && usage.empty() && playbacks.empty() && issues.empty();
    }
};

// "volume stretch x5, summary" (a count of one is left out); "-" for none.
std::string QVReportingCtlCountsText(const std::map<std::string, std::size_t>& counts);
// A session's issues and captures in the same form.
std::string QVReportingCtlSessionIssuesText(const ReportSession& session);

// "2026-11-26 09:52:33" (UTC) for seconds since 1970.
std::string QVReportingCtlShortUTC(double secondsSince1970);

// Reads <stateDir>/sinks. Throws std::runtime_error when the state directory or its sinks
// directory is missing or unreadable.
ReportData QVReportingCtlGatherReport(const std::string& stateDir, const ReportFilter& filter);

// A time given on the command line: seconds since 1970 as the sinks write them
// ("1795686753.25"), or an ISO 8601 date and time: "2026-11-26", "2026-11-26T09:52",
// "2026-11-26 09:52:33.5", with "Z" or "+01:00" for its zone, else local time. A date alone is
// its midnight. Nothing for anything else.
std::optional<double> QVReportingCtlParseReportTime(std::string_view text);

}  // namespace qv::client
