#include "platform/SinkSegments.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <system_error>

namespace qv {

namespace {

constexpr std::string_view kSuffix = ".jsonl";
constexpr std::size_t kSeqDigits = 12;
constexpr std::size_t kReadBytes = 64 * 1024;

bool isSpace(char c) {
    return c == ' ' || c == '\t' || c == '\r';
}

bool allDigits(std::string_view text) {
    return !text.empty() &&
           std::all_of(text.begin(), text.end(), [](char c) { return c >= '0' && c <= '9'; });
}

std::optional<std::uint64_t> parseSeq(std::string_view digits) {
    if (!allDigits(digits) || digits.size() > 20) {
        return std::nullopt;
    }
    std::uint64_t value = 0;
    for (char c : digits) {
        const auto digit = static_cast<std::uint64_t>(c - '0');
        if (value > (UINT64_MAX - digit) / 10) {
            return std::nullopt;
        }
        value = value * 10 + digit;
    }
    return value;
}

// The first seq in a closed segment's file name of this sink ("NAME.000000000123.jsonl").
std::optional<std::uint64_t> closedSegmentSeq(std::string_view fileName, std::string_view sink) {
    if (fileName.size() <= sink.size() + 1 + kSuffix.size() || !fileName.starts_with(sink) ||
        fileName[sink.size()] != '.' || !fileName.ends_with(kSuffix)) {
        return std::nullopt;
    }
    const std::string_view digits =
        fileName.substr(sink.size() + 1, fileName.size() - sink.size() - 1 - kSuffix.size());
    if (digits.size() < kSeqDigits) {
        return std::nullopt;
    }
    return parseSeq(digits);
}

// Entries that are regular files themselves (a link to one is not a segment).
bool isRegularEntry(const std::filesystem::directory_entry& entry) {
    std::error_code ec;
    return entry.symlink_status(ec).type() == std::filesystem::file_type::regular;
}

}  // namespace

std::string QVReportingSinkSegmentName(std::string_view sink, std::uint64_t firstSeq) {
    std::string digits = std::to_string(firstSeq);
    if (digits.size() < kSeqDigits) {
        digits.insert(0, kSeqDigits - digits.size(), '0');
    }
    std::string name(sink);
    name += '.';
    name += digits;
    name += kSuffix;
    return name;
}

std::vector<SinkSegment> QVReportingListSinkSegments(const std::filesystem::path& sinksDir,
                                                     std::string_view sink) {
    std::vector<SinkSegment> closed;
    std::optional<SinkSegment> current;
    const std::string currentName = std::string(sink) + std::string(kSuffix);
    std::error_code ec;
    for (const auto& entry : std::filesystem::directory_iterator(sinksDir, ec)) {
        if (!isRegularEntry(entry)) {
            continue;
        }
        const std::string name = entry.path().filename().string();
        if (name == currentName) {
            current = SinkSegment{entry.path(), 0, true};
        } else if (auto seq = closedSegmentSeq(name, sink)) {
            closed.push_back(SinkSegment{entry.path(), *seq, false});
        }
    }
    std::sort(closed.begin(), closed.end(), [](const SinkSegment& a, const SinkSegment& b) {
        return a.firstSeq != b.firstSeq ? a.firstSeq < b.firstSeq : a.path < b.path;
    });
    if (current) {
        closed.push_back(std::move(*current));
    }
    return closed;
}

std::vector<std::string> QVReportingListSinks(const std::filesystem::path& sinksDir) {
    std::vector<std::string> sinks;
    std::error_code ec;
    for (const auto& entry : std::filesystem::directory_iterator(sinksDir, ec)) {
        const std::string name = entry.path().filename().string();
        if (name.size() <= kSuffix.size() || !name.ends_with(kSuffix) || !isRegularEntry(entry)) {
            continue;
        }
        std::string_view stem(name.data(), name.size() - kSuffix.size());
        if (const auto dot = stem.rfind('.'); dot != std::string_view::npos &&
                                              stem.size() - dot - 1 >= kSeqDigits &&
                                              parseSeq(stem.substr(dot + 1))) {
            stem = stem.substr(0, dot);
        }
        if (!stem.empty() && stem[0] != '.') {
            sinks.emplace_back(stem);
        }
    }
    std::sort(sinks.begin(), sinks.end());
    sinks.erase(std::unique(sinks.begin(), sinks.end()), sinks.end());
    return sinks;
}

std::optional<std::uint64_t> QVReportingSinkLineSeq(std::string_view line) {
    std::size_t i = 0;
    const auto skipSpaces = [&] {
        while (i < line.size() && isSpace(line[i])) {
            ++i;
        }
    };
    const auto expect = [&](std::string_view token) {
        skipSpaces();
        if (line.substr(i, token.size()) != token) {
            return false;
        }
        i += token.size();
        return true;
    };
    if (!expect("{") || !expect("\"time\"") || !expect(":")) {
        return std::nullopt;
    }
    skipSpaces();
    const std::size_t timeStart = i;
    while (i < line.size() && std::string_view("0123456789+-.eE").find(line[i]) != line.npos) {
        ++i;
    }
    if (i == timeStart || !expect(",") || !expect("\"seq\"") || !expect(":")) {
        return std::nullopt;
    }
    skipSpaces();
    const std::size_t seqStart = i;
    while (i < line.size() && line[i] >= '0' && line[i] <= '9') {
        ++i;
    }
    const auto seq = parseSeq(line.substr(seqStart, i - seqStart));
    skipSpaces();
    if (!seq || i >= line.size() || (line[i] != ',' && line[i] != '}')) {
        return std::nullopt;
    }
    return seq;
}

// --- SinkLineReader
// -------------------------------------------------------------------------------

SinkLineReader::SinkLineReader(std::filesystem::path sinksDir, std::string sink,
                               std::uint64_t afterSeq)
    : sinksDir_(std::move(sinksDir)), sink_(std::move(sink)), lastSeq_(afterSeq) {}

SinkLineReader::~SinkLineReader() {
    closeFile();
}

std::optional<SinkLineReader::Line> SinkLineReader::next() {
    for (;;) {
        if (fd_ < 0 && !openNext()) {
            return std::nullopt;
        }
        while (auto text = takeLine()) {
            const auto seq = QVReportingSinkLineSeq(*text);
            if (!seq) {
                continue;
            }
            if (fileFirstSeq_ == 0) {
                fileFirstSeq_ = *seq;
            }
            if (*seq <= lastSeq_) {
                continue;
            }
            lastSeq_ = *seq;
            return Line{*seq, std::move(*text)};
        }
        if (fill()) {
            continue;
        }
        if (fileIsCurrent_) {
            if (!currentWasRenamed()) {
                return std::nullopt;  // the end for now: the daemon will append more
            }
            // Renamed: it will not grow any more, and what was written before the rename can
            // still be read through our descriptor. Drained like a closed segment from here.
            fileIsCurrent_ = false;
            continue;
        }
        doneThrough_ = std::max({doneThrough_, fileFirstSeq_, lastSeq_});
        closeFile();
    }
}

bool SinkLineReader::openNext() {
    auto segments = QVReportingListSinkSegments(sinksDir_, sink_);
    if (!started_) {
        // Start in the last closed segment that can hold the line after lastSeq_; when every
        // closed segment starts later (expired ones, or a fresh reader), in the first one.
        started_ = true;
        for (const auto& segment : segments) {
            if (!segment.current && segment.firstSeq <= lastSeq_ + 1) {
                doneThrough_ = segment.firstSeq - 1;
            }
        }
    }
    const auto nextClosed = [&] {
        return std::find_if(segments.begin(), segments.end(), [&](const SinkSegment& s) {
            return !s.current && s.firstSeq > doneThrough_;
        });
    };
    for (;;) {
        auto it = nextClosed();
        if (it != segments.end()) {
            if (openFile(*it)) {
                return true;
            }
            doneThrough_ = it->firstSeq;  // expired meanwhile, or not a regular file
            continue;
        }
        if (segments.empty() || !segments.back().current || !openFile(segments.back())) {
            return false;
        }
        // The current segment may have been renamed between the listing and the open: then the
        // file opened is a newer current one, and a closed segment not yet read comes first.
        segments = QVReportingListSinkSegments(sinksDir_, sink_);
        if (nextClosed() == segments.end()) {
            return true;
        }
        closeFile();
    }
}

bool SinkLineReader::openFile(const SinkSegment& segment) {
    int fd;
    do {
        fd = ::open(segment.path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
    } while (fd < 0 && errno == EINTR);
    if (fd < 0) {
        return false;
    }
    struct stat st {};
    if (::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        ::close(fd);
        return false;
    }
    fd_ = fd;
    fileIsCurrent_ = segment.current;
    fileFirstSeq_ = segment.firstSeq;
    offset_ = 0;
    buffer_.clear();
    start_ = 0;
    atEnd_ = false;
    skippingLongLine_ = false;
    return true;
}

void SinkLineReader::closeFile() {
    if (fd_ >= 0) {
        ::close(fd_);
        fd_ = -1;
    }
}

bool SinkLineReader::fill() {
    buffer_.erase(0, start_);
    start_ = 0;
    std::size_t reread = 0;
    if (atEnd_ && !buffer_.empty() && !skippingLongLine_) {
        // An unfinished line at the end is read again from its start: the daemon starting again
        // cuts a torn last line and writes new lines in its place.
        reread = buffer_.size();
        offset_ -= reread;
        buffer_.clear();
    }
    const std::size_t had = buffer_.size();
    buffer_.resize(had + kReadBytes);
    ssize_t n;
    do {
        n = ::pread(fd_, buffer_.data() + had, kReadBytes, static_cast<off_t>(offset_));
    } while (n < 0 && errno == EINTR);
    const auto got = static_cast<std::size_t>(std::max<ssize_t>(n, 0));
    buffer_.resize(had + got);
    offset_ += got;
    atEnd_ = got < kReadBytes;
    if (got == 0) {
        // A file cut below what was read (not by the daemon, which cuts only a torn line) is
        // read on from its new end.
        struct stat st {};
        if (::fstat(fd_, &st) == 0 && static_cast<std::uint64_t>(st.st_size) < offset_) {
            offset_ = static_cast<std::uint64_t>(st.st_size);
            buffer_.clear();
            skippingLongLine_ = false;
        }
    }
    // Something new: more bytes than were read again, or a line in their place.
    return got > reread || (got > 0 && buffer_.find('\n') != std::string::npos);
}

bool SinkLineReader::currentWasRenamed() const {
    struct stat open {};
    struct stat named {};
    if (::fstat(fd_, &open) != 0) {
        return true;
    }
    const auto path = sinksDir_ / (sink_ + std::string(kSuffix));
    if (::lstat(path.c_str(), &named) != 0) {
        return true;
    }
    return open.st_dev != named.st_dev || open.st_ino != named.st_ino;
}

std::optional<std::string> SinkLineReader::takeLine() {
    for (;;) {
        const auto end = buffer_.find('\n', start_);
        if (end == std::string::npos) {
            if (buffer_.size() - start_ > kMaxLineBytes) {
                // Too long to hold: dropped, with the rest of it up to its line feed.
                buffer_.clear();
                start_ = 0;
                skippingLongLine_ = true;
            }
            return std::nullopt;
        }
        const std::size_t from = start_;
        start_ = end + 1;
        if (skippingLongLine_) {
            skippingLongLine_ = false;
            continue;
        }
        return buffer_.substr(from, end - from);
    }
}

}  // namespace qv
