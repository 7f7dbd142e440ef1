// The bug-filing prompt service on Linux. Every draft is recorded in the "issuefiler" sink
// (<stateDir>/sinks/issuefiler.jsonl), and the person at the desktop is prompted with a desktop
// notification (org.freedesktop.Notifications.Notify) on the session bus, when there is one and a
// notification service runs on it. Two lines per draft:
//   {"op": "draft", "draft": N, "processName": ..., "displayReason": ..., "title": ...,
//    "problemDescription": ..., "component": {"name", "version", "identifier"},
//    "reproducibility": R, "classification": C, "diagnosticExtensionIdentifiers": [...]}
//   {"op": "prompt", "draft": N, "shown": true, "notification": ID}
//   {"op": "prompt", "draft": N, "shown": false, "reason": "..."}
// N numbers the drafts of this process from 1.
//
// What counts as an error: the draft is created when its line is recorded; the completion gets an
// error only when the sink refused the line (its buffer was full). Not being able to prompt (no
// session bus, no notification service on it, a service that fails or does not answer within the
// time-out) is no error of the draft's: the prompt line says why, and the notice callback hears
// of it (each cause once, until a prompt is shown again).
//
// The session bus: the one named by the options, which main() takes from
// DBUS_SESSION_BUS_ADDRESS, else the user's bus socket /run/user/UID/bus when it exists. A
// daemon that runs as a system service usually has neither, and then only records drafts.
//
// Threads: createDraft records the draft on the caller's thread (the sink never waits) and hands
// the prompt to the service's own thread, which talks to the bus with a time-out per call and then
// runs the completion. At most maxPendingPrompts prompts wait there (a notification service that
// hangs would otherwise pile them up); a draft that finds them all taken is recorded without a
// prompt, and its completion runs at once on the caller's thread.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/BoundedWriter.h"
#include "platform/IssueFilerService.h"
#include "platform/linux/sinks/JsonlSink.h"

namespace qv {

class LinuxIssueFilerService final : public IssueFilerService {
  public:
    static constexpr std::string_view kSinkName = "issuefiler";
    // A desktop notification service answers within milliseconds; one that takes longer than
    // this is given up on, so a hung one costs one thread a couple of seconds per prompt.
    static constexpr std::chrono::milliseconds kDefaultNotifyTimeout{2000};
    static constexpr std::size_t kDefaultMaxPendingPrompts = 16;

    struct Options {
        // D-Bus address of the session bus; nothing: drafts are recorded only.
        std::optional<std::string> sessionBusAddress;
        std::chrono::milliseconds notifyTimeout = kDefaultNotifyTimeout;
        std::size_t maxPendingPrompts = kDefaultMaxPendingPrompts;
        // Told why a prompt could not be shown, each cause once; runs on the service's thread.
        std::function<void(const std::string& message)> notice;
    };

    LinuxIssueFilerService(std::unique_ptr<JsonlSink> sink, Options options);
    // Records the prompts still waiting as not shown (their completions run), then ends the
    // thread; a prompt being shown finishes within its time-out.
    ~LinuxIssueFilerService() override;

    LinuxIssueFilerService(const LinuxIssueFilerService&) = delete;
    LinuxIssueFilerService& operator=(const LinuxIssueFilerService&) = delete;

    void createDraft(const IssueDraft& draft, std::string_view processName,
                     std::string_view displayReason, Completion completion) override;

    // Blocks until every prompt asked for so far is done and its lines are in the file.
    void flush();
    const JsonlSink& sink() const { return *sink_; }

    // The session bus of the daemon's user: environmentAddress (DBUS_SESSION_BUS_ADDRESS) when
    // set and not empty, else "unix:path=/run/user/UID/bus" when that socket exists, else
    // nothing. runtimeRoot stands for /run/user in tests.
    static std::optional<std::string> sessionBusAddressFor(
        const char* environmentAddress, unsigned uid, const std::string& runtimeRoot = "/run/user");

  private:
    struct Prompt {
        std::int64_t number = 0;
        std::string summary;
        std::string body;
        std::shared_ptr<Completion> completion;
        std::optional<std::string> error;
    };

    // The service's thread only.
    void show(Prompt& prompt);
    void recordPrompt(std::int64_t number, const std::optional<std::uint32_t>& notification,
                      const std::string& reason);
    void noteCause(const std::string& cause);

    const std::unique_ptr<JsonlSink> sink_;
    const Options options_;
    std::mutex mutex_;
    std::int64_t nextDraft_ = 1;  // guarded by mutex_
    std::string lastCause_;       // the service's thread only: "" after a prompt was shown
    // A run of prompts refused for a full queue is noticed once; cleared by the next accepted one.
    std::atomic<bool> promptsOverflowing_{false};
    std::atomic<bool> stopping_{false};
    // Last: its thread runs prompts that use the members above.
    BoundedWriter<Prompt> thread_;
};

}  // namespace qv
