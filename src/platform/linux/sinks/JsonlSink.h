// A sink file: <stateDir>/sinks/<name>.jsonl, one JSON object a line, each starting with "time"
// (seconds since 1970, a double, read from the clock when the line is appended) and "seq" (the
// sink's line number, from 1 over the life of the state directory) followed by the caller's
// members in their order. This is where the Linux stand-ins of the platform's telemetry services
// put what they receive.
//
// Segments (see platform/SinkSegments.h): <name>.jsonl is the current segment. Before a line
// that would go into a segment already past SinkSegmentPolicy's bytes, or begun more than its
// seconds before the line's time, the segment is renamed to <name>.<SEQ>.jsonl (SEQ: its first
// line's seq) and a new one begins; the closed segments' shared budget is then enforced. At the
// first open the seq goes on from the newest segment's last whole line (the current one, else
// the newest closed one). A line that is lost gives its seq to the next one, so the files' seqs
// run without gaps unless a budget removed a segment.
//
// The file is opened without following a link and without blocking, and must be a regular file:
// anything else in its place (a pipe, a device, a link) is refused, said once and counted, and
// the lines meant for it are lost.
//
// append() never waits: lines go through a bounded buffer to the sink's own thread, which turns
// them into JSON and writes them on an O_APPEND descriptor as soon as it is woken: each write(2)
// holds only whole lines (all those queued, up to kMaxWriteBytes), so a line reaches its file
// promptly and whole even when other processes append too, and a busy sink costs one system call
// for many lines. A crash in the middle of a write can leave a torn last line: the next run
// removes it before writing (and tells tornLineRemoved), so the file stays whole JSON lines. A
// line that finds the buffer full is dropped; a line that cannot be written (the directory cannot
// be made, the file cannot be opened, the write fails or falls short) is lost; either way the
// loss is counted through the callbacks and the sink goes on, opening the file afresh for the
// next line after a failure. The file and its directory are made when missing.
//
// Values in JSON: integers exactly (unsigned 64-bit included), doubles with every digit needed
// to read them back, bytes as base64 text, dates as doubles, dictionaries in insertion order;
// text that is not valid UTF-8 has its bad bytes replaced rather than losing the line.
//
// Thread safety: append() and flush() may be called from any thread at once. The callbacks run
// on the caller's thread (buffer full) or on the sink's thread (write failures), never under a
// lock of the sink's.
#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/BoundedWriter.h"
#include "values/Value.h"

namespace qv {

class Clock;
class DiskBudget;

// When a sink closes its current segment, and the budget of the closed ones.
struct SinkSegmentPolicy {
    static constexpr std::uint64_t kDefaultSegmentBytes = std::uint64_t{64} << 20;
    static constexpr double kDefaultSegmentSeconds = 86400;
    std::uint64_t segmentBytes = kDefaultSegmentBytes;
    double segmentSeconds = kDefaultSegmentSeconds;  // from the segment's first line, by the Clock
    // Shared by every sink of the daemon; null keeps every closed segment.
    std::shared_ptr<DiskBudget> closedSegments;
};

// How a sink tells its owner about trouble. Platform code neither counts nor logs by itself:
// main() wires these to the guardrail counters and to the log.
struct SinkCallbacks {
    // One line lost (buffer full, or not written); called once per line.
    std::function<void(std::string_view sinkName)> lineLost;
    // A torn last line (left by a crash in the middle of a write) removed from the file.
    std::function<void(std::string_view sinkName)> tornLineRemoved;
    // A problem worth an error line: the text names the sink and the cause. Repeats of the same
    // cause are not reported again until a line is written or the cause changes, so a broken
    // disk costs one log line, not one per event; lineLost still hears of every line.
    std::function<void(const std::string& message)> problem;
    // Something other than a regular file in the sink file's place (reported with problem).
    std::function<void(const std::string& path)> fileRefused;
};

class JsonlSink {
  public:
    // Lines held for the sink's thread before further lines are dropped.
    static constexpr std::size_t kDefaultCapacity = 4096;
    // Memory the lines held for the sink's thread may take (as their values estimate it), so
    // that a flood of large messages cannot queue gigabytes for a disk that falls behind.
    static constexpr std::size_t kMaxQueuedBytes = std::size_t{16} << 20;
    // How long the sink's thread gathers lines before it writes them: a few milliseconds of delay
    // on disk, against a wake-up of the thread for every line under load.
    static constexpr std::chrono::microseconds kLinger{2000};

    // name must be a plain file name (the daemon names its sinks); it is made safe all the same.
    // Nothing is opened yet: the first line makes the directory and opens the file.
    JsonlSink(std::string stateDir, std::string name, const Clock& clock, SinkCallbacks callbacks,
              std::size_t capacity = kDefaultCapacity, SinkSegmentPolicy segments = {});
    // Writes every line still queued, then closes the file.
    ~JsonlSink();

    JsonlSink(const JsonlSink&) = delete;
    JsonlSink& operator=(const JsonlSink&) = delete;

    // Queues one line: "time" now, then members in order (a member called "time" would take the
    // stamp's place, so callers use names of their own). Returns false when the line was dropped
    // because the buffer is full.
    bool append(Dictionary members);

    // Blocks until every line appended before this call has been written or given up.
    void flush();
    // As flush(), but gives up at deadline; true when every line was written or given up by then.
    bool flushUntil(std::chrono::steady_clock::time_point deadline);

    // Flushes every sink of the process, all within one deadline: what an exit does first, so
    // that what the sinks accepted is in their files. True when all of them made it.
    static bool flushAll(std::chrono::steady_clock::time_point deadline);

    const std::string& name() const { return name_; }
    const std::string& path() const { return path_; }

  private:
    struct Line {
        double time = 0;
        Dictionary members;
    };

    // Lines are written this many bytes at a time at most, when many are queued.
    static constexpr std::size_t kMaxWriteBytes = 256 * 1024;

    // The sink's thread only, from here down.
    void writeBatch(std::deque<Line>& lines);
    // Appends the line's JSON text, with seq, and its line feed to out.
    void formatLine(std::string& out, const Line& line, std::uint64_t seq);
    // Appends a member's JSON text to out; false when it holds text that is not UTF-8.
    bool appendMember(std::string& out, const Value& value);
    // Writes text, which holds `lines` whole lines; on failure they are lost and their seqs go
    // to the next lines.
    void writeText(const std::string& text, std::size_t lines);
    // Makes the directory and opens the file when no descriptor is open; false with a reason.
    bool openFile(std::string& reason);
    // On the first open: a last line cut short by a crash is removed, so the file stays whole
    // JSON lines.
    void repairTornTail();
    // On the first open: the next seq, and the current segment's first seq and time.
    void recoverSegment();
    // Whether the line must begin a new segment.
    bool segmentIsFull(const Line& line, std::size_t pendingBytes) const;
    // Renames the current segment to its closed name and enforces the budget.
    void closeSegment();
    bool cutOwnFragment(std::size_t bytes);
    void closeFile();
    void lose(const std::string& reason, std::size_t lines = 1);

    const std::string name_;
    const std::string directory_;
    const std::string path_;
    const Clock& clock_;
    const SinkCallbacks callbacks_;
    const std::size_t capacity_;
    const SinkSegmentPolicy segments_;
    // A run of drops for a full buffer is reported once; cleared by the next accepted line.
    std::atomic<bool> dropping_{false};

    int fd_ = -1;                  // sink's thread only
    std::string lastProblem_;      // sink's thread only: the cause last reported, "" when healthy
    std::uint64_t lostInRun_ = 0;  // sink's thread only: lines lost since the last written one
    bool tailChecked_ = false;     // sink's thread only: the file's end was looked at
    bool tornByUs_ = false;        // sink's thread only: our last write ended inside a line
    std::string text_;             // sink's thread only: lines being written
    // Sink's thread only, for one batch: the dictionary member last written and its text. An
    // analytics event goes out under two names with equal payloads, one line after the other.
    Value lastDictionary_;
    std::string lastDictionaryText_;
    bool threadPrepared_ = false;  // sink's thread only: its priority lowered
    // Sink's thread only: the segment being written.
    std::uint64_t nextSeq_ = 1;
    std::uint64_t segmentFirstSeq_ = 0;  // 0 while the current segment holds no line
    double segmentStartTime_ = 0;        // its first line's time
    std::uint64_t segmentBytes_ = 0;     // its size
    bool closeProblem_ = false;          // a failed rename was reported

    // Last, and reset first in the destructor: its thread uses every member above.
    std::unique_ptr<BoundedWriter<Line>> writer_;
};

}  // namespace qv
