#include "platform/linux/JsonlSink.h"

#include <fcntl.h>
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
#include "platform/linux/ThreadPriority.h"
#include "values/ValueJson.h"

namespace qv {

namespace {

std::string errnoText(int error) {
    return std::error_code(error, std::generic_category()).message();
}

// Every live sink, for flushAll(). Sinks come and go only at start-up, shutdown and in tests.
std::mutex gSinksMutex;
std::vector<JsonlSink*> gSinks;  // guarded by gSinksMutex

// Where a torn last line starts in a file of `size` bytes: just after its last line feed (0 when
// it has none); -1 when the file ends with a line feed or cannot be read.
off_t startOfTornLine(int fd, off_t size) {
    char block[4096];
    off_t end = size;
    bool atEnd = true;
    while (end > 0) {
        const off_t from = std::max<off_t>(0, end - static_cast<off_t>(sizeof block));
        const ssize_t n = ::pread(fd, block, static_cast<std::size_t>(end - from), from);
        if (n != end - from) {
            return -1;
        }
        for (ssize_t i = n - 1; i >= 0; --i) {
            if (block[i] == '\n') {
                return atEnd && i == n - 1 ? -1 : from + i + 1;
            }
            atEnd = false;
        }
        end = from;
    }
    return 0;
}

}  // namespace

JsonlSink::JsonlSink(std::string stateDir, std::string name, const Clock& clock,
                     SinkCallbacks callbacks, std::size_t capacity)
    : name_(std::move(name)),
      directory_((std::filesystem::path(stateDir) / "sinks").string()),
      path_((std::filesystem::path(directory_) / (QVReportingSafeFileComponent(name_) + ".jsonl"))
                .string()),
      clock_(clock),
      callbacks_(std::move(callbacks)),
      capacity_(std::max<std::size_t>(capacity, 1)),
      writer_(std::make_unique<BoundedWriter<Line>>(
          BoundedWriter<Line>::kBatches, capacity_,
          [this](std::deque<Line>& lines) { writeBatch(lines); })) {
    writer_->setMaxBytes(kMaxQueuedBytes);
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

void JsonlSink::formatLine(std::string& out, const Line& line) {
    const std::size_t start = out.size();
    out += "{\"time\":";
    QVReportingAppendJsonText(out, Value(line.time));
    bool valid = true;
    for (const auto& [key, value] : line.members) {
        out += ',';
        valid = QVReportingAppendJsonText(out, Value(std::string_view(key))) && valid;
        out += ':';
        valid = valid && QVReportingAppendJsonText(out, value);
        if (!valid) {
            break;
        }
    }
    if (!valid) {
        // Text that is not valid UTF-8 has its bad bytes replaced rather than losing the line.
        out.resize(start);
        nlohmann::ordered_json object = nlohmann::ordered_json::object();
        object["time"] = line.time;
        for (const auto& [key, value] : line.members) {
            object[key] = QVReportingValueToJson(value);
        }
        out += object.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace);
    } else {
        out += '}';
    }
    out += '\n';
}

void JsonlSink::writeBatch(std::deque<Line>& lines) {
    if (!threadPrepared_) {
        threadPrepared_ = true;
        QVReportingLowerOwnThreadPriority(kBackgroundNiceness);
    }
    text_.clear();
    std::size_t pending = 0;
    for (const Line& line : lines) {
        try {
            formatLine(text_, line);
        } catch (const std::exception& e) {
            lose(fmt::format("cannot format a line: {}", e.what()));
            continue;
        }
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
    // A burst's buffer is not kept for the quiet that follows.
    if (text_.capacity() > kMaxWriteBytes * 2) {
        std::string().swap(text_);
    }
}

void JsonlSink::writeText(const std::string& text, std::size_t lines) {
    std::string reason;
    if (!openFile(reason)) {
        lose(reason, lines);
        return;
    }
    std::string_view rest = text;
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
    int fd;
    do {
        fd = ::open(path_.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
    } while (fd < 0 && errno == EINTR);
    if (fd < 0) {
        reason = fmt::format("cannot open {}: {}", path_, errnoText(errno));
        return false;
    }
    fd_ = fd;
    if (!tailChecked_) {
        tailChecked_ = true;
        repairTornTail();
    }
    return true;
}

void JsonlSink::repairTornTail() {
    struct stat st {};
    if (::fstat(fd_, &st) != 0 || !S_ISREG(st.st_mode) || st.st_size == 0) {
        return;
    }
    // The sink's own descriptor only writes (a pipe in the file's place must not be read).
    const int reader = ::open(path_.c_str(), O_RDONLY | O_CLOEXEC);
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
