// Guardrails: the limits the daemon puts on what clients send, and a count of every time a limit
// was hit or a line was lost, so that nothing is refused or dropped silently. Operators read the
// counters through dump() (the ReportingStats interface on the bus, `qvreportctl stats`).
//
// Thread safety: every member may be called from any thread; counters are atomics and the few
// maps are guarded by a mutex.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <map>
#include <mutex>
#include <string>
#include <string_view>

#include "values/Value.h"

namespace qv {

// Defaults of the limits on client input; each may be overridden on the daemon's command line.
struct QVReportingLimits {
    // A payload or configuration, measured as D-Bus wire bytes: beyond this a client is sending
    // data, not a report.
    std::size_t maxPayloadBytes = 1024 * 1024;
    // Values in one payload or configuration, nested ones included.
    std::size_t maxPayloadValues = 10000;
    // Nesting of containers in one payload; deeper input is refused before any recursion.
    std::size_t maxPayloadDepth = 16;
    // Reporter IDs named by one message.
    std::size_t maxReporterIDsPerMessage = 1024;
    // Sessions one client may hold at once.
    std::size_t maxSessionsPerClient = 4096;
    // Clients connected at once.
    std::size_t maxClients = 256;
};

class QVReportingStats {
  public:
    enum class Limit {
        PayloadBytes,
        PayloadValues,
        PayloadDepth,
        ReporterIDs,
        SessionsPerClient,
        Clients
    };

    static QVReportingStats& shared();

    void noteLimitExceeded(Limit limit);
    // A call refused for its content (a value of a type payloads cannot hold, say).
    void noteInputRefused();
    // A log line that found the journal's buffer full.
    void noteLogLineDropped();
    // A line a sink could not write, or that found its buffer full.
    void noteSinkLineLost(std::string_view sink);
    // A request the issue-capture service refused (its policy, or no room); reason names the
    // error code.
    void noteIssueCaptureRefused(std::string_view reason);
    void noteClientCount(std::size_t clients);
    void noteSessionCount(std::size_t sessions);

    std::uint64_t limitExceededCount(Limit limit) const;
    std::uint64_t logLinesDropped() const { return logLinesDropped_.load(); }
    std::uint64_t sinkLinesLost(std::string_view sink) const;
    std::uint64_t issueCaptureRefused(std::string_view reason) const;

    // Every counter by name, for the operator.
    Dictionary dump() const;

    // For tests only: zero every counter.
    void TEST_reset();

  private:
    static constexpr std::size_t kLimitKinds = 6;
    // At most this many distinct sink names are tracked; sinks are few and named by the daemon.
    static constexpr std::size_t kMaxTrackedSinks = 32;

    std::atomic<std::uint64_t> limitsExceeded_[kLimitKinds] = {};
    std::atomic<std::uint64_t> inputRefused_{0};
    std::atomic<std::uint64_t> logLinesDropped_{0};
    std::atomic<std::uint64_t> clients_{0};
    std::atomic<std::uint64_t> clientsMax_{0};
    std::atomic<std::uint64_t> sessions_{0};
    std::atomic<std::uint64_t> sessionsMax_{0};
    mutable std::mutex mutex_;
    std::map<std::string, std::uint64_t, std::less<>> sinkLinesLost_;        // guarded by mutex_
    std::map<std::string, std::uint64_t, std::less<>> issueCaptureRefused_;  // guarded by mutex_
};

}  // namespace qv
