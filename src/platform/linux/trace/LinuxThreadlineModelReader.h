// The trace-model reader on Linux: reads the text trace that LinuxSpanTraceRecorder copies out of
// its tracefs instance and pairs the trace_marker texts into probe events.
//
// What is read: every line "<task>-<pid> [<cpu>] <flags> <seconds>.<fraction>: tracing_mark_write:
// <text>" is one marker, written by task <pid> at that time (the trace clock's, "mono" when the
// kernel offers it); blanks around the text are ignored and the text must equal a probe's marker
// exactly. Other events (scheduling, interrupts) are skipped. The kernel's count of events it
// could not keep (the "entries-in-buffer/entries-written" header, "[LOST n EVENTS]" lines) and a
// trace cut short by the recorder's size cap are kept for the summary.
//
// How markers pair, for each probe on its own:
// - per task: a begin and an end pair only when the same task (thread) wrote both, so threads
//   and CPUs that run the same probe at once interleave freely;
// - nesting: an end closes the most recent open begin of its probe on its task (innermost first),
//   so a probe that recurses gets one event per level; different probes nest and overlap freely;
// - unpaired: an end with no open begin on its task is dropped, and so is a begin still open when
//   the trace ends; both are counted in the probe's description;
// - an interval that begins on one thread and ends on another is not measured (two unpaired
//   markers);
// - events are given in the order they began (ties by task), named after their probe, with their
//   duration in nanoseconds (the model's time base); an end stamped before its begin (clock
//   trouble) gives 0.
// A probe list is evaluated in one pass over the markers, so 10^5 pairs take milliseconds.
//
// Thread safety: the reader has no state; a model is immutable once built.
#pragma once

#include <cstdint>
#include <string_view>

#include "platform/ThreadlineModelReader.h"

namespace qv {

class LinuxThreadlineModelReader final : public ThreadlineModelReader {
  public:
    // Larger traces are read up to this many bytes (the recorder caps what it copies at the same
    // size); the summary says the rest was left unread.
    static constexpr std::uint64_t kDefaultMaxTraceBytes = 128ull * 1024 * 1024;

    explicit LinuxThreadlineModelReader(std::uint64_t maxTraceBytes = kDefaultMaxTraceBytes)
        : maxTraceBytes_(maxTraceBytes) {}

    // Fails when the file cannot be opened or is not a regular file.
    Built modelFromTraceFile(const std::filesystem::path& location) override;

    // A model of trace text in memory (the same format), for tests and benchmarks.
    static Built modelFromTraceText(std::string_view text);

  private:
    const std::uint64_t maxTraceBytes_;
};

}  // namespace qv
