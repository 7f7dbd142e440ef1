// The conversation-quality reporting service on Linux: an in-process service with a thread of
// its own, whose sessions write what they receive to the "convo" sink
// (<stateDir>/sinks/convo.jsonl), one line per event:
//   {"op": "session", "session": N, "sessionInfo": {...}, "userInfo": {...}}   a new session
//   {"op": "message", "session": N, "sessionID": ID, "category": C, "type": T, "payload": {...}}
//   {"op": "flush", "session": N, "sessionID": ID}
// N numbers the sessions of this process from 1; ID is the session info's SessionID.
//
// It answers from the defaults suite "com.korvane.qvsound.convo", read afresh at every question:
// - "Enabled" false: the service is unavailable (no hierarchy token); absent or true: available;
// - "Backends": the list of backend names that receive sessions (default ["jsonl"]); an empty
//   list, or one that holds no name, means no backend, so configurations complete with nothing.
//
// Configuration completions run on the service's thread, in the order they were asked for. That
// thread takes at most kMaxPendingCompletions questions at a time; one asked beyond is dropped
// and never answered (the asker's wait times out), which keeps a flood of sessions from growing
// the service without bound.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <string>

#include "platform/BoundedWriter.h"
#include "platform/ConvoService.h"
#include "platform/linux/sinks/JsonlSink.h"

namespace qv {

class PreferenceStore;

class LinuxConvoService final : public ConvoService {
  public:
    static constexpr std::string_view kSinkName = "convo";
    static constexpr std::string_view kSuite = "com.korvane.qvsound.convo";
    static constexpr std::string_view kEnabledKey = "Enabled";
    static constexpr std::string_view kBackendsKey = "Backends";
    static constexpr std::size_t kMaxPendingCompletions = 1024;

    LinuxConvoService(const PreferenceStore& preferences, std::unique_ptr<JsonlSink> sink);
    // Answers the questions still queued, then ends the thread.
    ~LinuxConvoService() override;

    LinuxConvoService(const LinuxConvoService&) = delete;
    LinuxConvoService& operator=(const LinuxConvoService&) = delete;

    std::optional<std::string> newHierarchyTokenFromParentToken(
        const std::optional<std::string>& parent) override;
    std::shared_ptr<ConvoSession> createSession(
        const Dictionary& sessionInfo, const Dictionary& userInfo,
        const std::optional<std::vector<std::string>>& frameworksToCheck) override;

    // Blocks until every line written so far is in the file.
    void flush() { sink_->flush(); }
    const JsonlSink& sink() const { return *sink_; }

  private:
    class Session;

    // The backends the suite names now, or nothing for none.
    std::optional<std::vector<std::string>> currentBackends() const;
    // Runs task on the service's thread; false when too many are waiting (task dropped).
    bool post(std::function<void()> task);

    const PreferenceStore& preferences_;
    const std::unique_ptr<JsonlSink> sink_;
    std::atomic<std::uint64_t> nextToken_{1};
    std::atomic<std::int64_t> nextSession_{1};
    // Last: its thread runs tasks that use the members above.
    BoundedWriter<std::function<void()>> thread_;
};

}  // namespace qv
