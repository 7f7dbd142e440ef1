#include "platform/linux/JsonlSink.h"

#include <fcntl.h>
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
#include "values/ValueJson.h"

namespace qv {

namespace {

std::string errnoText(int error) {
    return std::error_code(error, std::generic_category()).message();
}

// Every live sink, for flushAll(). Sinks come and go only at start-up, shutdown and in tests.
std::mutex gSinksMutex;
std::vector<JsonlSink*> gSinks;  // guarded by gSinksMutex

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
      writer_(std::make_unique<BoundedWriter<Line>>(capacity_,
                                                    [this](Line& line) { writeLine(line); })) {
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
    if (writer_->push(Line{clock_.now(), std::move(members)})) {
        dropping_.store(false, std::memory_order_relaxed);
        return true;
    }
    if (callbacks_.lineLost) {
        callbacks_.lineLost(name_);
    }
    if (!dropping_.exchange(true, std::memory_order_relaxed) && callbacks_.problem) {
        callbacks_.problem(fmt::format("sink {}: its buffer of {} lines is full, dropping lines",
                                       name_, capacity_));
    }
    return false;
}

void JsonlSink::flush() {
    writer_->flush();
}

void JsonlSink::writeLine(Line& line) {
    std::string text;
    try {
        nlohmann::ordered_json object = nlohmann::ordered_json::object();
        object["time"] = line.time;
        for (const auto& [key, value] : line.members) {
            object[key] = QVReportingValueToJson(value);
        }
        text = object.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace);
    } catch (const std::exception& e) {
        lose(fmt::format("cannot format a line: {}", e.what()));
        return;
    }
    text.push_back('\n');

    std::string reason;
    if (!openFile(reason)) {
        lose(reason);
        return;
    }
    // One write per line: with O_APPEND the line lands whole at the end, whoever else appends.
    ssize_t written;
    do {
        written = ::write(fd_, text.data(), text.size());
    } while (written < 0 && errno == EINTR);
    if (written == static_cast<ssize_t>(text.size())) {
        if (!lastProblem_.empty() && callbacks_.problem) {
            callbacks_.problem(fmt::format("sink {}: writing to {} again after {} lost lines",
                                           name_, path_, lostInRun_));
        }
        lastProblem_.clear();
        lostInRun_ = 0;
        return;
    }
    if (written < 0) {
        reason = fmt::format("cannot write to {}: {}", path_, errnoText(errno));
    } else {
        reason = fmt::format("short write to {}: {} of {} bytes", path_, written, text.size());
    }
    // A descriptor that failed once is not trusted again: the next line opens the file afresh.
    closeFile();
    lose(reason);
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
    return true;
}

void JsonlSink::closeFile() {
    if (fd_ >= 0) {
        ::close(fd_);
        fd_ = -1;
    }
}

void JsonlSink::lose(const std::string& reason) {
    ++lostInRun_;
    if (callbacks_.lineLost) {
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
