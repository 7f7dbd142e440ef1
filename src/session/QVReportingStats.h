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
    // Memory a session's stored messages may take (estimated); past it, messages are still
    // forwarded to the workers but not stored. A busy session holds a few MiB.
    std::size_t maxSessionStoreBytes = std::size_t{64} << 20;
    // Memory the stored messages of all sessions together may take.
    std::size_t maxStoreBytes = std::size_t{512} << 20;
    // Memory of one client's calls taken in from the bus and not yet answered (the call as
    // received, its decoded arguments and the queued work; kCallOverheadBytes at least a call).
    // Past it the client's further calls are refused at once, without decoding them, while the
    // daemon reads on, so that one flooding client neither grows the daemon nor delays others.
    std::size_t maxCallBytesPerClient = std::size_t{16} << 20;
    // The same for all clients together. Past it the daemon stops reading the bus until its work
    // drains below it: nothing is refused, and the bus holds (and limits) what senders send.
    std::size_t maxCallBytes = std::size_t{128} << 20;
    // Calls whose answer waits on a later event (a start call, answered when its session stops)
    // that one client may hold; a client holds one a started session. Further such calls are
    // refused.
    std::size_t maxHeldCallsPerClient = 4096;
    // The same for all clients together.
    std::size_t maxHeldCalls = 32768;
    // Payload bytes one client may send a second, on average; bursts up to
    // maxCallBytesPerClient pass at once. Every client's calls reach the daemon through its one
    // connection to the bus, read in arrival order, and reading a payload costs time (its text is
    // checked byte by byte): without this, one client sending large payloads as fast as it can
    // would hold up every other client's calls behind its own. A real client sends a few KiB a
    // second. Past it, calls are refused before they are read.
    std::size_t maxPayloadBytesPerSecondPerClient = std::size_t{64} << 20;
};

class QVReportingStats {
  public:
    enum class Limit {
        PayloadBytes,
        PayloadValues,
        PayloadDepth,
        ReporterIDs,
        SessionsPerClient,
        Clients,
        CallBytesPerClient,
        HeldCallsPerClient,
        HeldCalls,
        PayloadRatePerClient,
        // A direct connection whose client left this many replies unread was closed.
        DirectRepliesUnread
    };

    static QVReportingStats& shared();

    // Distinct keys a session remembers in its previous values (the last value of every key it
    // was sent). Real clients use a few dozen; beyond this, new keys are not remembered (known
    // keys still update), so a client inventing keys cannot grow the daemon without bound.
    static constexpr std::size_t kMaxPreviousValuesKeys = 16384;
    // What a call costs the daemon while it is taken in and not answered, beyond its arguments:
    // the message as received, the pending entry and the queued task (measured: about 1.5 KiB).
    static constexpr std::size_t kCallOverheadBytes = 2048;

    void noteLimitExceeded(Limit limit);
    // A call refused for its content (a value of a type payloads cannot hold, say).
    void noteInputRefused();
    // A log line that found the journal's buffer full.
    void noteLogLineDropped();
    // A line a sink could not write, or that found its buffer full.
    void noteSinkLineLost(std::string_view sink);
    // A torn last line (a crash in the middle of a write) removed from a sink file at start.
    void noteSinkTornLineRemoved();
    // A request the issue-capture service refused (its policy, or no room); reason names the
    // error code.
    void noteIssueCaptureRefused(std::string_view reason);
    // --- Files on disk ---
    // Bytes of closed sink segments removed to keep the sinks within their disk budget.
    void noteSinkBytesExpired(std::string_view sink, std::uint64_t bytes);
    // Bytes of files under logs/Audio/ removed to keep a directory within its budget; dir names
    // it ("reporting", "spinlogs").
    void noteLogBytesExpired(std::string_view dir, std::uint64_t bytes);
    // A file that is not what it should be (a pipe, a device, a directory or a link where a
    // regular file belongs, or one past its size limit), refused.
    void noteFileRefused();
    std::uint64_t sinkBytesExpired(std::string_view sink) const;
    std::uint64_t filesRefused() const { return filesRefused_.load(); }

    void noteClientCount(std::size_t clients);
    void noteSessionCount(std::size_t sessions);
    // Calls taken in and not yet answered: their bytes (QVReportingLimits' call budgets) and the
    // held ones among them.
    void noteCallBudget(std::size_t callBytes, std::size_t heldCalls);
    // The daemon stopped reading the bus for want of call budget.
    void noteBusReadsPaused();

    // --- Direct connections (the daemon's own socket beside the bus) ---
    // A connection was accepted on the direct socket.
    void noteDirectConnection();

    // The store budgets sessions keep to (QVReportingLimits' two store limits).
    void setStoreBudgets(std::size_t perSession, std::size_t total);
    // Takes bytes for a session that already stores sessionBytes: false, with nothing taken,
    // when that would pass the session's budget or the daemon's.
    bool reserveStoreBytes(std::size_t sessionBytes, std::size_t bytes);
    // Takes bytes whatever the budgets say (a session's own state messages).
    void forceStoreBytes(std::size_t bytes);
    // Gives back what a session took, when its messages go.
    void releaseStoreBytes(std::size_t bytes);
    // A message forwarded but not stored, for want of budget.
    void noteMessageNotStored();
    // A key not remembered in a session's previous values (kMaxPreviousValuesKeys).
    void notePreviousValueDropped();
    std::uint64_t storeBytes() const { return storeBytes_.load(); }
    std::uint64_t messagesNotStored() const { return messagesNotStored_.load(); }

    std::uint64_t limitExceededCount(Limit limit) const;
    std::uint64_t logLinesDropped() const { return logLinesDropped_.load(); }
    std::uint64_t sinkLinesLost(std::string_view sink) const;
    std::uint64_t issueCaptureRefused(std::string_view reason) const;

    // Every counter by name, for the operator.
    Dictionary dump() const;

    // For tests only: zero every counter and restore the default budgets (bytes still taken by
    // live sessions stay counted).
    void TEST_reset();

  private:
    static constexpr std::size_t kLimitKinds = 11;
    // At most this many distinct sink names are tracked; sinks are few and named by the daemon.
    static constexpr std::size_t kMaxTrackedSinks = 32;

    std::atomic<std::uint64_t> limitsExceeded_[kLimitKinds] = {};
    std::atomic<std::uint64_t> inputRefused_{0};
    std::atomic<std::uint64_t> logLinesDropped_{0};
    std::atomic<std::uint64_t> clients_{0};
    std::atomic<std::uint64_t> clientsMax_{0};
    std::atomic<std::uint64_t> sessions_{0};
    std::atomic<std::uint64_t> sessionsMax_{0};
    std::atomic<std::uint64_t> sessionStoreBudget_{QVReportingLimits{}.maxSessionStoreBytes};
    std::atomic<std::uint64_t> storeBudget_{QVReportingLimits{}.maxStoreBytes};
    std::atomic<std::uint64_t> storeBytes_{0};
    std::atomic<std::uint64_t> storeBytesMax_{0};
    std::atomic<std::uint64_t> messagesNotStored_{0};
    std::atomic<std::uint64_t> previousValuesDropped_{0};
    std::atomic<std::uint64_t> sinkTornLinesRemoved_{0};
    std::atomic<std::uint64_t> callBytes_{0};
    std::atomic<std::uint64_t> callBytesMax_{0};
    std::atomic<std::uint64_t> heldCalls_{0};
    std::atomic<std::uint64_t> heldCallsMax_{0};
    std::atomic<std::uint64_t> busReadsPaused_{0};
    std::atomic<std::uint64_t> directConnectionsAccepted_{0};
    mutable std::mutex mutex_;
    std::map<std::string, std::uint64_t, std::less<>> sinkLinesLost_;        // guarded by mutex_
    std::map<std::string, std::uint64_t, std::less<>> issueCaptureRefused_;  // guarded by mutex_
    // Files on disk.
    std::atomic<std::uint64_t> filesRefused_{0};
    std::map<std::string, std::uint64_t, std::less<>> bytesExpired_;  // guarded by mutex_
};

}  // namespace qv
