// The segments of a sink as they lie in <stateDir>/sinks, and a reader of a sink's lines across
// them. The daemon writes a sink's lines to its current segment NAME.jsonl; past a size or an age
// that file is renamed to NAME.SEQ.jsonl (SEQ: the 12-digit, zero-padded "seq" of its first line)
// and a new current segment begins. Closed segments are removed oldest first when the sinks pass
// their disk budget. Every line is {"time":...,"seq":N,...}: N counts the sink's lines from 1 and
// is never reused, so (sink, seq) names one line for good.
//
// The standard library only: qvreportctl and the exporter link this and nothing else of the
// daemon.
//
// Thread safety: the free functions only read the directory; a SinkLineReader is used by one
// thread at a time.
#pragma once

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace qv {

struct SinkSegment {
    std::filesystem::path path;
    std::uint64_t firstSeq = 0;  // from a closed segment's name; 0 for the current segment
    bool current = false;        // NAME.jsonl
};

// "NAME.000000000123.jsonl": 12-digit zero-padded seq of the segment's first line.
std::string QVReportingSinkSegmentName(std::string_view sink, std::uint64_t firstSeq);

// Closed segments by name (so by first seq), then the current one when it exists. Only regular
// files count (a link or a pipe in a segment's place is not a segment).
std::vector<SinkSegment> QVReportingListSinkSegments(const std::filesystem::path& sinksDir,
                                                     std::string_view sink);

// The sinks present in a directory (with a current file or closed segments), sorted.
std::vector<std::string> QVReportingListSinks(const std::filesystem::path& sinksDir);

// The "seq" member of a sink line (the second member, after "time"), or nothing.
std::optional<std::uint64_t> QVReportingSinkLineSeq(std::string_view line);

// Reads one sink's whole lines in seq order, starting after afterSeq, across closed segments and
// the current one, and follows the current segment as it grows and as the daemon renames it
// (rotation: the reader keeps reading the renamed file to its end through its open descriptor,
// then opens the new NAME.jsonl). A line without its line feed yet is not returned.
//
// Files are opened O_RDONLY|O_NOFOLLOW|O_NONBLOCK|O_CLOEXEC and must be regular files; anything
// else in a segment's place is passed over. Lines without a "seq", and lines whose seq is not
// above the last one returned, are passed over too, so seq strictly increases; a line longer
// than kMaxLineBytes is passed over whole.
class SinkLineReader {
  public:
    static constexpr std::size_t kMaxLineBytes = std::size_t{64} << 20;

    SinkLineReader(std::filesystem::path sinksDir, std::string sink, std::uint64_t afterSeq);
    ~SinkLineReader();

    SinkLineReader(const SinkLineReader&) = delete;
    SinkLineReader& operator=(const SinkLineReader&) = delete;

    struct Line {
        std::uint64_t seq;
        std::string text;  // without the line feed
    };

    // The next whole line, or nothing when none is there now (call again later to follow).
    // A jump in seq (segments expired by the disk budget before they were read) shows as a gap
    // between consecutive lines' seq; the caller counts it.
    std::optional<Line> next();

    // The seq of the last line returned (afterSeq before the first).
    std::uint64_t lastSeq() const { return lastSeq_; }

  private:
    // Opens the segment that holds the line after lastSeq_ (or the first after a gap); false when
    // there is none now.
    bool openNext();
    bool openFile(const SinkSegment& segment);
    void closeFile();
    // Reads what the open file holds past offset_ into buffer_; false at its end.
    bool fill();
    // The current segment, read to its end: true when NAME.jsonl is now another file (or gone),
    // so that this one was closed and will not grow any more.
    bool currentWasRenamed() const;
    // A whole line from buffer_, or nothing when none is complete.
    std::optional<std::string> takeLine();

    const std::filesystem::path sinksDir_;
    const std::string sink_;
    std::uint64_t lastSeq_;

    int fd_ = -1;
    bool fileIsCurrent_ = false;
    // The first seq of the open file, from its name or its first line; 0 while unknown.
    std::uint64_t fileFirstSeq_ = 0;
    // Closed segments with a first seq at or below this are done with.
    std::uint64_t doneThrough_ = 0;
    bool started_ = false;
    std::uint64_t offset_ = 0;  // bytes of the open file moved into buffer_
    std::string buffer_;        // read but not yet returned
    std::size_t start_ = 0;     // where the unreturned part of buffer_ begins
    bool atEnd_ = false;        // the last read reached the file's end
    bool skippingLongLine_ = false;
};

}  // namespace qv
