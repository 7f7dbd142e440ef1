// The performance-trace recorder on Linux: ftrace through tracefs.
//
// Each recording gets a trace instance of its own, instances/qvreportd-<pid>-<n> under the
// tracefs root (the first of /sys/kernel/tracing and /sys/kernel/debug/tracing that is a mounted
// tracefs, unless the options name one), so it neither disturbs nor sees other users' tracing.
// At start the instance is given kDefaultBufferKbPerCpu of ring buffer per CPU (the kernel keeps
// the newest events when it fills, and says how many it overwrote), the "mono" trace clock when
// offered, the copying of markers written to the top-level trace_marker (the kernel's
// copy_trace_marker option, where it exists), and the events of its template:
// - template 2: scheduling (sched_switch, sched_waking, sched_wakeup, sched_wakeup_new,
//   sched_migrate_task, sched_process_fork, sched_process_exec, sched_process_exit);
// - template 3: template 2, interrupts (irq_handler_entry/exit, softirq_raise/entry/exit) and the
//   audio subsystems' events the kernel offers (asoc, snd_pcm, hda, hda_controller, hda_intel,
//   sof, sof_intel).
// Events the kernel does not offer are skipped. Markers written to the instance's own
// trace_marker are always recorded.
//
// At stop, tracing is switched off, the instance's text trace is copied to
// <traceDirectory>/qvreportd-<pid>-<n>.trace (a header line of its own, then the kernel's text),
// at most maxTraceBytes of it (a note at the end says when it was cut), and the instance is
// removed. Only the newest maxTraceFiles traces are kept in that directory. An instance that
// cannot be removed yet (a program still holds one of its files open) has its buffer shrunk and
// is removed at a later recording or when the recorder goes. Instances that a previous run left
// behind (their process is gone, or its number now belongs to a process started after the
// instance was made) are removed at the first recording.
//
// Failure: where tracefs cannot be used (not mounted, no instances, no permission, no memory for
// the buffer), the start callback reports the error and the recording completes at once without a
// trace. Problems that no callback reports (leftover instances, a trace cut at its cap, old
// traces that cannot be removed) go to the problem callback.
//
// All tracefs and file work runs on one thread of the recorder's own, which also runs the
// delegate callbacks; recordings are served in the order they were asked for.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/SpanTraceRecorder.h"

namespace qv {

class LinuxSpanTraceRecorder final : public SpanTraceRecorder {
  public:
    static constexpr unsigned kDefaultBufferKbPerCpu = 8192;
    static constexpr std::uint64_t kDefaultMaxTraceBytes = 128ull * 1024 * 1024;
    static constexpr std::size_t kDefaultMaxTraceFiles = 4;

    struct Options {
        // Where finished traces go (the state directory's logs/Audio/Traces/raw in the daemon).
        std::filesystem::path traceDirectory;
        // The tracefs root to use; empty: the first mounted of /sys/kernel/tracing and
        // /sys/kernel/debug/tracing.
        std::filesystem::path tracefsRoot;
        unsigned bufferKbPerCpu = kDefaultBufferKbPerCpu;
        std::uint64_t maxTraceBytes = kDefaultMaxTraceBytes;
        std::size_t maxTraceFiles = kDefaultMaxTraceFiles;
    };

    // problem receives one readable line per problem; it runs on the recorder's thread.
    LinuxSpanTraceRecorder(Options options, std::function<void(const std::string&)> problem);
    // Recordings still running are switched off and their instances removed, without callbacks;
    // then the thread ends.
    ~LinuxSpanTraceRecorder() override;

    LinuxSpanTraceRecorder(const LinuxSpanTraceRecorder&) = delete;
    LinuxSpanTraceRecorder& operator=(const LinuxSpanTraceRecorder&) = delete;

    // Templates 2 and 3; null for any other.
    std::shared_ptr<SpanTraceConfiguration> configurationFromTemplate(int templateNumber) override;
    std::shared_ptr<SpanTraceSession> createSession(
        const SpanTraceConfiguration& configuration) override;

    // The events template 2 or 3 asks for: "system:event" for one event, "system" for all of a
    // subsystem's.
    static std::vector<std::string> templateEvents(int templateNumber);

    // Blocks until everything asked of the recorder so far has been done (callbacks included).
    void drain();

    struct Core;

  private:
    std::shared_ptr<Core> core_;
};

}  // namespace qv
