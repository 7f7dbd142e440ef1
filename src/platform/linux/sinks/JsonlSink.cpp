#include "platform/linux/sinks/JsonlSink.h"

#include <fcntl.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <exception>
#include <filesystem>
#include <mutex>
#include <system_error>
#include <vector>

#include <fmt/format.h>
#include <nlohmann/json.hpp>

#include "platform/Clock.h"
#include "platform/SafeFileName.h"
#include "platform/SinkSegments.h"
#include "platform/linux/sinks/DiskBudget.h"
#include "platform/linux/sinks/RegularFile.h"
#include "platform/linux/system/ErrnoText.h"
#include "platform/linux/system/ThreadPriority.h"
#include "values/ValueJson.h"

namespace qv {

namespace {

// Every live sink, for flushAll(). Sinks come and go only at start-up, shutdown and in tests.
std::mutex gSinksMutex;
std::vector<JsonlSink*> gSinks;  // guarded by gSinksMutex

// Where the line that ends just before `end` starts: just after the line feed before it.
off_t startOfLineBefore(int fd, off_t end) {
    char block[4096];
    while (end > 0) {
        const off_t from = std::max<off_t>(0, end - static_cast<off_t>(sizeof block));
        const ssize_t n = ::pread(fd, block, static_cast<std::size_t>(end - from), from);
        if (n != end - from) {
            return -1;
        }
        for (ssize_t i = n - 1; i >= 0; --i) {
            if (block[i] == '\n') {
                return from + i + 1;
            }
        }
        end = from;
    }
    return 0;
}

// Where a torn last line starts in a file of `size` bytes: just after its last line feed (0 when
// it has none); -1 when the file ends with a line feed or cannot be read.
off_t startOfTornLine(int fd, off_t size) {
    if (size == 0) {
        return 0;
    }
    char last = 0;
    if (::pread(fd, &last, 1, size - 1) != 1) {
        return -1;
    }
    return last == '\n' ? -1 : startOfLineBefore(fd, size);
}

// The start of the line at offset: enough for its "time" and "seq".
std::string lineHead(int fd, off_t offset) {
    std::string head(256, '\0');
    const ssize_t n = ::pread(fd, head.data(), head.size(), offset);
    head.resize(static_cast<std::size_t>(std::max<ssize_t>(n, 0)));
    return head;
}

// The "time" of a line's head, when it starts as a sink line does.
std::optional<double> lineTime(const std::string& head) {
    constexpr std::string_view prefix = "{\"time\":";
    if (!head.starts_with(prefix)) {
        return std::nullopt;
    }
    char* end = nullptr;
    const double time = std::strtod(head.c_str() + prefix.size(), &end);
    return end == head.c_str() + prefix.size() ? std::nullopt : std::optional<double>(time);
}

// The seq of the last whole line of a sink file (a torn tail after it is passed over).
std::optional<std::uint64_t> lastLineSeq(int fd, off_t size) {
    const off_t torn = startOfTornLine(fd, size);
    const off_t end = torn < 0 ? size : torn;
    if (end <= 0) {
        return std::nullopt;
    }
    const off_t start = startOfLineBefore(fd, end - 1);
    return start < 0 ? std::nullopt : QVReportingSinkLineSeq(lineHead(fd, start));
}

// A file opened to be read, without following a link or blocking; -1 unless it is regular.
int openRegularForReading(const std::string& path, struct stat& st) {
    const int fd = ::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
    if (fd >= 0 && (::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode))) {
        ::close(fd);
        return -1;
    }
    return fd;
}

}  // namespace

JsonlSink::JsonlSink(std::string stateDir, std::string name, const Clock& clock,
                     SinkCallbacks callbacks, std::size_t capacity, SinkSegmentPolicy segments)
    : name_(std::move(name)),
      directory_((std::filesystem::path(stateDir) / "sinks").string()),
      path_((std::filesystem::path(directory_) / (QVReportingSafeFileComponent(name_) + ".jsonl"))
                .string()),
      clock_(clock),
      callbacks_(std::move(callbacks)),
      capacity_(std::max<std::size_t>(capacity, 1)),
      segments_(std::move(segments)),
      writer_(std::make_unique<BoundedWriter<Line>>(
          BoundedWriter<Line>::kBatches, capacity_,
          [this](std::deque<Line>& lines) { writeBatch(lines); })) {
    writer_->setMaxBytes(kMaxQueuedBytes);
    writer_->setLinger(kLinger);
    std::lock_guard lock(gSinksMutex);
    gSinks.push_back(this);
}

JsonlSink::~JsonlSink() {
    {
        std::lock_guard lock(gSinksMutex);
        std::erase(gSinks, this);
    }
    writer_.reset();  // writes what is queued and ends the thread before the file goes
    closeFile();
}

bool JsonlSink::flushUntil(std::chrono::steady_clock::time_point deadline) {
    return writer_->flushUntil(deadline);
}

bool JsonlSink::flushAll(std::chrono::steady_clock::time_point deadline) {
    // Under the lock, so no sink can go away meanwhile; a sink's writer never takes this lock.
    std::lock_guard lock(gSinksMutex);
    bool all = true;
    for (JsonlSink* sink : gSinks) {
        all = sink->flushUntil(deadline) && all;
    }
    return all;
}

bool JsonlSink::append(Dictionary members) {
    const std::size_t bytes = members.approximateHeapBytes();
    if (writer_->push(Line{clock_.now(), std::move(members)}, bytes)) {
        dropping_.store(false, std::memory_order_relaxed);
        return true;
    }
    if (callbacks_.lineLost) {
        callbacks_.lineLost(name_);
    }
    if (!dropping_.exchange(true, std::memory_order_relaxed) && callbacks_.problem) {
        callbacks_.problem(
            fmt::format("sink {}: its buffer ({} lines, {} bytes) is full, dropping lines", name_,
                        capacity_, kMaxQueuedBytes));
    }
    return false;
}

void JsonlSink::flush() {
    writer_->flush();
}

void JsonlSink::formatLine(std::string& out, const Line& line, std::uint64_t seq) {
    const std::size_t start = out.size();
    out += "{\"time\":";
    QVReportingAppendJsonText(out, Value(line.time));
    out += ",\"seq\":";
    QVReportingAppendJsonText(out, Value(seq));
    bool valid = true;
    for (const auto& [key, value] : line.members) {
        out += ',';
        valid = QVReportingAppendJsonString(out, key) && valid;
        out += ':';
        valid = valid && appendMember(out, value);
        if (!valid) {
            break;
        }
    }
    if (!valid) {
        // Text that is not valid UTF-8 has its bad bytes replaced rather than losing the line.
        out.resize(start);
        nlohmann::ordered_json object = nlohmann::ordered_json::object();
        object["time"] = line.time;
        object["seq"] = seq;
        for (const auto& [key, value] : line.members) {
            object[key] = QVReportingValueToJson(value);
        }
        out += object.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace);
    } else {
        out += '}';
    }
    out += '\n';
}

bool JsonlSink::appendMember(std::string& out, const Value& value) {
    const Dictionary* dictionary = value.asDictionary();
    if (!dictionary) {
        return QVReportingAppendJsonText(out, value);
    }
    if (const Dictionary* last = lastDictionary_.asDictionary();
        last && last->size() == dictionary->size() &&
        std::equal(last->begin(), last->end(), dictionary->begin(),
                   [](const auto& a, const auto& b) {
                       return a.first == b.first && a.second.sameAs(b.second);
                   })) {
        out += lastDictionaryText_;
        return true;
    }
    const std::size_t start = out.size();
    if (!QVReportingAppendJsonText(out, value)) {
        return false;
    }
    lastDictionary_ = value;
    lastDictionaryText_.assign(out, start);
    return true;
}

void JsonlSink::writeBatch(std::deque<Line>& lines) {
    if (!threadPrepared_) {
        threadPrepared_ = true;
        QVReportingLowerOwnThreadPriority(kBackgroundNiceness);
    }
    text_.clear();
    std::size_t pending = 0;
    std::string reason;
    for (const Line& line : lines) {
        // The file is open before a line is numbered: the first open finds where the seq is.
        if (!openFile(reason)) {
            lose(reason);
            continue;
        }
        if (segmentIsFull(line, text_.size())) {
            if (pending > 0) {
                writeText(text_, pending);
                text_.clear();
                pending = 0;
            }
            closeSegment();
            if (!openFile(reason)) {
                lose(reason);
                continue;
            }
        }
        try {
            formatLine(text_, line, nextSeq_);
        } catch (const std::exception& e) {
            lose(fmt::format("cannot format a line: {}", e.what()));
            continue;
        }
        if (segmentFirstSeq_ == 0) {
            segmentFirstSeq_ = nextSeq_;
            segmentStartTime_ = line.time;
        }
        ++nextSeq_;
        ++pending;
        if (text_.size() >= kMaxWriteBytes) {
            writeText(text_, pending);
            text_.clear();
            pending = 0;
        }
    }
    if (pending > 0) {
        writeText(text_, pending);
    }
    lastDictionary_ = Value();  // nor a payload, which may be large
    // A burst's buffer is not kept for the quiet that follows.
    if (text_.capacity() > kMaxWriteBytes * 2) {
        std::string().swap(text_);
    }
}

void JsonlSink::writeText(const std::string& text, std::size_t lines) {
    std::string reason;
    if (!openFile(reason)) {
        nextSeq_ -= lines;
        lose(reason, lines);
        return;
    }
    std::string_view rest = text;
    const std::uint64_t firstSeq = nextSeq_ - lines;
    if (tornByUs_) {
        // Our last write stopped inside a line: end that fragment so these lines stay whole.
        if (::write(fd_, "\n", 1) == 1) {
            tornByUs_ = false;
        }
    }
    while (!rest.empty()) {
        const ssize_t n = ::write(fd_, rest.data(), rest.size());
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            break;
        }
        rest.remove_prefix(static_cast<std::size_t>(n));
        segmentBytes_ += static_cast<std::uint64_t>(n);
    }
    if (rest.empty()) {
        if (!lastProblem_.empty() && callbacks_.problem) {
            callbacks_.problem(fmt::format("sink {}: writing to {} again after {} lost lines",
                                           name_, path_, lostInRun_));
        }
        lastProblem_.clear();
        lostInRun_ = 0;
        return;
    }
    const int error = errno;
    const std::string_view written(text.data(), text.size() - rest.size());
    if (!written.empty()) {  // else an earlier torn line is still torn
        const auto lastEnd = written.rfind('\n');
        const std::size_t fragment =
            lastEnd == std::string_view::npos ? written.size() : written.size() - lastEnd - 1;
        const bool cut = fragment == 0 || cutOwnFragment(fragment);
        // Without a line feed in this write, an earlier fragment may still sit before this one.
        tornByUs_ = lastEnd == std::string_view::npos ? tornByUs_ || !cut : !cut;
    }
    const auto whole = static_cast<std::size_t>(std::count(written.begin(), written.end(), '\n'));
    // The lines not written give their seqs to the next ones.
    nextSeq_ = firstSeq + whole;
    if (segmentFirstSeq_ >= nextSeq_) {
        segmentFirstSeq_ = 0;
    }
    reason = fmt::format("cannot write to {}: {}", path_, errnoText(error));
    // A descriptor that failed once is not trusted again: the next lines open the file afresh.
    closeFile();
    lose(reason, lines - whole);
}

// The file's last bytes are the start of a line that did not fit: taking them off keeps every
// line of the file whole JSON. Shrinking a file needs no space, so this works on a full disk.
bool JsonlSink::cutOwnFragment(std::size_t bytes) {
    struct stat st {};
    if (::fstat(fd_, &st) != 0 || !S_ISREG(st.st_mode) ||
        static_cast<std::size_t>(st.st_size) < bytes) {
        return false;
    }
    return ::ftruncate(fd_, st.st_size - static_cast<off_t>(bytes)) == 0;
}

bool JsonlSink::openFile(std::string& reason) {
    if (fd_ >= 0) {
        return true;
    }
    std::error_code ec;
    std::filesystem::create_directories(directory_, ec);
    if (ec) {
        reason = fmt::format("cannot create {}: {}", directory_, ec.message());
        return false;
    }
    // Neither a pipe (which would block the open until a reader came) nor a link is written.
    int fd;
    do {
        fd = ::open(path_.c_str(),
                    O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK, 0644);
    } while (fd < 0 && errno == EINTR);
    struct stat st {};
    if (fd >= 0 && ::fstat(fd, &st) == 0 && S_ISREG(st.st_mode)) {
        fd_ = fd;
        segmentBytes_ = static_cast<std::uint64_t>(st.st_size);
        if (!tailChecked_) {
            tailChecked_ = true;
            repairTornTail();
            recoverSegment();
        }
        return true;
    }
    const int error = errno;
    if (fd >= 0) {
        ::close(fd);
        reason = fmt::format("refused {}: it is {}, not a regular file", path_,
                             QVReportingFileKind(st.st_mode));
    } else if (error == ELOOP || error == ENXIO || error == EISDIR) {
        struct stat link {};
        reason = fmt::format("refused {}: it is {}, not a regular file", path_,
                             ::lstat(path_.c_str(), &link) == 0 ? QVReportingFileKind(link.st_mode)
                                                                : "of an unknown kind");
    } else {
        reason = fmt::format("cannot open {}: {}", path_, errnoText(error));
        return false;
    }
    if (reason != lastProblem_ && callbacks_.fileRefused) {
        callbacks_.fileRefused(path_);
    }
    return false;
}

void JsonlSink::recoverSegment() {
    struct stat st {};
    std::optional<std::uint64_t> last;
    if (const int reader = openRegularForReading(path_, st); reader >= 0) {
        if (st.st_size > 0) {
            const std::string head = lineHead(reader, 0);
            segmentFirstSeq_ = QVReportingSinkLineSeq(head).value_or(0);
            segmentStartTime_ = lineTime(head).value_or(clock_.now());
            last = lastLineSeq(reader, st.st_size);
        }
        ::close(reader);
    }
    if (!last) {
        // An empty current segment (or one of lines without a seq): the newest closed one says.
        auto segments = QVReportingListSinkSegments(directory_, name_);
        if (!segments.empty() && segments.back().current) {
            segments.pop_back();
        }
        if (!segments.empty()) {
            const auto& newest = segments.back();
            nextSeq_ = std::max(nextSeq_, newest.firstSeq + 1);
            if (const int reader = openRegularForReading(newest.path.string(), st); reader >= 0) {
                last = lastLineSeq(reader, st.st_size);
                ::close(reader);
            }
        }
    }
    if (last) {
        nextSeq_ = std::max(nextSeq_, *last + 1);
    }
    if (segmentBytes_ > 0 && segmentFirstSeq_ == 0) {
        // Lines without a seq: the segment is named after the first line that has one.
        segmentFirstSeq_ = nextSeq_;
        segmentStartTime_ = clock_.now();
    }
}

bool JsonlSink::segmentIsFull(const Line& line, std::size_t pendingBytes) const {
    return segmentFirstSeq_ != 0 && (segmentBytes_ + pendingBytes >= segments_.segmentBytes ||
                                     line.time - segmentStartTime_ >= segments_.segmentSeconds);
}

void JsonlSink::closeSegment() {
    const std::string closed =
        (std::filesystem::path(directory_) /
         QVReportingSinkSegmentName(QVReportingSafeFileComponent(name_), segmentFirstSeq_))
            .string();
    // Never over another segment: seqs are not reused, so a name taken means something is amiss.
    if (::renameat2(AT_FDCWD, path_.c_str(), AT_FDCWD, closed.c_str(), RENAME_NOREPLACE) != 0) {
        if (!closeProblem_ && callbacks_.problem) {
            callbacks_.problem(
                fmt::format("sink {}: cannot close the segment {} as {}: {}; "
                            "writing on in it",
                            name_, path_, closed, errnoText(errno)));
        }
        closeProblem_ = true;
        return;
    }
    closeProblem_ = false;
    closeFile();
    segmentFirstSeq_ = 0;
    segmentBytes_ = 0;
    if (segments_.closedSegments) {
        segments_.closedSegments->enforce();
    }
}

void JsonlSink::repairTornTail() {
    struct stat st {};
    if (::fstat(fd_, &st) != 0 || !S_ISREG(st.st_mode) || st.st_size == 0) {
        return;
    }
    // The sink's own descriptor only writes.
    struct stat readSt {};
    const int reader = openRegularForReading(path_, readSt);
    if (reader < 0) {
        return;
    }
    const off_t keep = startOfTornLine(reader, st.st_size);
    ::close(reader);
    if (keep < 0) {
        return;
    }
    if (::ftruncate(fd_, keep) != 0) {
        if (callbacks_.problem) {
            callbacks_.problem(fmt::format("sink {}: cannot remove the torn last line of {}: {}",
                                           name_, path_, errnoText(errno)));
        }
        return;
    }
    if (callbacks_.tornLineRemoved) {
        callbacks_.tornLineRemoved(name_);
    }
    segmentBytes_ = static_cast<std::uint64_t>(keep);
    if (callbacks_.problem) {
        callbacks_.problem(
            fmt::format("sink {}: removed a torn last line of {} bytes from {} (left by a crash)",
                        name_, st.st_size - keep, path_));
    }
}

void JsonlSink::closeFile() {
    if (fd_ >= 0) {
        ::close(fd_);
        fd_ = -1;
    }
}

void JsonlSink::lose(const std::string& reason, std::size_t lines) {
    lostInRun_ += lines;
    for (std::size_t i = 0; i < lines && callbacks_.lineLost; ++i) {
        callbacks_.lineLost(name_);
    }
    if (reason != lastProblem_) {
        lastProblem_ = reason;
        if (callbacks_.problem) {
            callbacks_.problem(fmt::format("sink {}: line lost: {}", name_, reason));
        }
    }
}

}  // namespace qv
