// The issue-capture service on Linux: an in-process service with a thread of its own. Requests
// and replies go to the "issuecapture" sink (<stateDir>/sinks/issuecapture.jsonl), one line each:
//   {"op": "snapshot", "signature": {...}, "duration": D, "payload": {...}, "sessionID": ID}
//   {"op": "session",  "signature": {...}, "duration": D, "payload": {...}, "sessionID": ID}
//   {"op": "cancel",   "sessionID": ID}
//   {"op": "reply",    "request": "snapshot"|"session"|"cancel", "sessionID": ID, "reply": {...}}
// ("sessionID" only when the request was accepted; "payload" only when given.) A snapshot is
// collected as soon as it is accepted; a timed session once its duration has passed without a
// cancel. Either way the capture lands in <capturesDirectory>/<ID>/ (IssueCaptureCollector.h):
// journal lines, /proc/PID/status files and manifest.json.
//
// Policy, from the defaults suite "com.korvane.qvsound.issuecapture", read afresh at each request:
// - "Enabled" (bool, default true): false answers kIssueCaptureErrorNotSupported;
// - "DailyLimit" (integer, default 20): captures accepted in any 24 hours (pending timed sessions
//   included; a cancelled one gives its place back); beyond: kIssueCaptureErrorDailyLimitExceeded.
//   Captures already on disk from earlier runs count too;
// - "SignatureIntervalSeconds" (default 600): one capture per signature in that time; sooner:
//   kIssueCaptureErrorRequestThrottled;
// - "JournalWindowSeconds" (default 300): how far before the request the journal is read;
// - "MaxJournalLines" (default 2000) and "MaxCaptureBytes" (default 1 MiB): per capture.
// A cancel of an identifier that is not a pending timed session (unknown, cancelled before, or
// already collected) is answered with kIssueCaptureErrorSessionNotFound in the sink.
//
// The door: once the thread has taken a capture of a signature (or refused one inside the
// interval), further requests of that signature inside the interval are refused with
// kIssueCaptureErrorRequestThrottled on the caller's thread, without queueing and without a sink
// line, so that a flood of one issue costs its senders next to nothing. A change of
// SignatureIntervalSeconds applies to a signature from its next capture.
//
// Bounds: at most kMaxQueuedRequests requests wait for the service's thread (besides the batch it
// is handling); one beyond is
// answered at once, on the caller's thread, with kIssueCaptureErrorServiceUnavailable, and leaves
// no sink line (a flood that fills the queue would only fill the sink next). At most
// kMaxPendingSessions timed sessions wait for their time; one beyond is answered with
// kIssueCaptureErrorServiceUnavailable. Every refusal is reported through Callbacks::refused.
//
// Time: every rule reads the Clock (wall time for the day and the signatures, steady time for
// session deadlines), so tests drive it; flush() has the thread look at its deadlines again.
//
// Thread safety: every member may be called from any thread. Replies run on the service's thread,
// except the immediate refusal of a request that finds the queue full.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <unordered_map>

#include "platform/IssueCaptureService.h"
#include "platform/linux/sinks/JsonlSink.h"

namespace qv {

class Clock;
class PreferenceStore;

class LinuxIssueCaptureService final : public IssueCaptureService {
  public:
    static constexpr std::string_view kSinkName = "issuecapture";
    static constexpr std::string_view kSuite = "com.korvane.qvsound.issuecapture";
    static constexpr std::string_view kEnabledKey = "Enabled";
    static constexpr std::string_view kDailyLimitKey = "DailyLimit";
    static constexpr std::string_view kSignatureIntervalKey = "SignatureIntervalSeconds";
    static constexpr std::string_view kJournalWindowKey = "JournalWindowSeconds";
    static constexpr std::string_view kMaxJournalLinesKey = "MaxJournalLines";
    static constexpr std::string_view kMaxCaptureBytesKey = "MaxCaptureBytes";

    static constexpr std::int64_t kDefaultDailyLimit = 20;
    static constexpr double kDefaultSignatureIntervalSeconds = 600.0;
    static constexpr double kDefaultJournalWindowSeconds = 300.0;
    static constexpr std::int64_t kDefaultMaxJournalLines = 2000;
    static constexpr std::int64_t kDefaultMaxCaptureBytes = 1024 * 1024;

    // Requests waiting for the service's thread.
    static constexpr std::size_t kMaxQueuedRequests = 256;
    // Timed sessions waiting for their duration to pass.
    static constexpr std::size_t kMaxPendingSessions = 16;
    // Signatures remembered for the interval rule; the oldest are forgotten first.
    static constexpr std::size_t kMaxTrackedSignatures = 4096;
    // A timed session or snapshot may not ask for more than a day.
    static constexpr double kMaxDurationSeconds = 86400.0;
    // A day, for the daily limit.
    static constexpr double kDaySeconds = 86400.0;

    struct Options {
        std::string capturesDirectory;                // <logs>/Audio/Captures
        std::optional<std::string> journalDirectory;  // the local journal when absent
        std::int64_t daemonPid = 0;
    };
    struct Callbacks {
        // A request refused by the policy or for want of room; reason is the error's name.
        std::function<void(std::string_view reason)> refused;
        // A problem worth an error line (a capture that could not be written).
        std::function<void(const std::string& message)> problem;
    };

    LinuxIssueCaptureService(const Clock& clock, const PreferenceStore& preferences,
                             std::unique_ptr<JsonlSink> sink, Options options, Callbacks callbacks);
    // Answers what is queued, abandons pending timed sessions (noted in the sink), ends the thread.
    ~LinuxIssueCaptureService() override;

    LinuxIssueCaptureService(const LinuxIssueCaptureService&) = delete;
    LinuxIssueCaptureService& operator=(const LinuxIssueCaptureService&) = delete;

    std::shared_ptr<IssueCaptureReporter> createReporter() override;

    // Blocks until every request made before has been handled and every timed session due by the
    // clock has been collected, then until the sink has written its lines.
    void flush();

    std::size_t pendingSessionCount() const { return pendingCount_.load(); }
    const JsonlSink& sink() const { return *sink_; }

  private:
    class Reporter;
    struct Policy;
    struct PendingSession {
        Dictionary signature;
        std::optional<Dictionary> payload;
        double duration = 0;
        double requested = 0;
        std::chrono::steady_clock::time_point deadline;
    };

    using ReplyCallback = IssueCaptureReporter::ReplyCallback;

    // Any thread.
    bool enqueue(std::function<void()> task);
    void refuseNow(std::int64_t reason, const ReplyCallback& reply);
    bool request(std::string_view kind, const Dictionary& signature, double duration,
                 const std::optional<Dictionary>& payload, ReplyCallback reply);
    void cancel(const std::string& identifier);
    // Whether the thread has already refused this signature until after now.
    bool throttledAtTheDoor(std::uint64_t key, double now) const;
    // The service's thread: the signature is refused until then.
    void publishThrottle(const Dictionary& signature, double until, double now);

    // The service's thread only, from here down.
    void run();
    void handleRequest(const std::string& kind, const Dictionary& signature, double duration,
                       const std::optional<Dictionary>& payload, double requested,
                       const ReplyCallback& reply);
    void handleCancel(const std::string& identifier);
    void collectDue();
    void collect(const std::string& id, const std::string& kind, const PendingSession& capture);
    std::optional<std::int64_t> policyRefusal(const Policy& policy, const std::string& key,
                                              double now);
    void answer(std::string_view request, const std::optional<std::string>& id,
                const Dictionary& reply, const ReplyCallback& callback);
    std::string newIdentifier(double now);
    void countEarlierCaptures();
    std::optional<std::chrono::steady_clock::duration> timeToNextDeadline() const;

    const Clock& clock_;
    const PreferenceStore& preferences_;
    const std::unique_ptr<JsonlSink> sink_;
    const Options options_;
    const Callbacks callbacks_;
    std::atomic<std::size_t> pendingCount_{0};
    // tasks_.size() as last set under mutex_, for a refusal that need not take the lock.
    std::atomic<std::size_t> queued_{0};

    std::mutex mutex_;
    std::condition_variable wake_;
    std::condition_variable done_;
    std::deque<std::function<void()>> tasks_;  // guarded by mutex_
    std::uint64_t tasksQueued_ = 0;            // guarded by mutex_
    std::uint64_t tasksDone_ = 0;              // guarded by mutex_
    bool stopping_ = false;                    // guarded by mutex_

    // What the thread decided about signatures, for requests to be refused before they queue.
    mutable std::mutex doorMutex_;
    // By a hash of the signature: a collision costs one signature a capture, never a flood.
    std::unordered_map<std::uint64_t, double> throttledUntil_;  // guarded by doorMutex_, capped

    // The service's thread only.
    std::map<std::string, PendingSession> pending_;
    std::deque<std::pair<double, std::string>> acceptedToday_;  // (time, id), oldest first
    std::unordered_map<std::string, double> lastBySignature_;
    std::uint64_t nextNumber_ = 1;

    std::thread thread_;  // last: starts once the members above exist
};

}  // namespace qv
