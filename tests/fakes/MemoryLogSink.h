// Keeps every logged line; ScopedMemoryLog installs it (debug on) and restores the previous sink.
#pragma once

#include <algorithm>
#include <mutex>
#include <string>
#include <vector>

#include "session/QVReportingLog.h"

namespace qv::test {

class MemoryLogSink : public LogSink {
  public:
    struct Line {
        LogLevel level;
        std::string category;
        std::string text;  // with the "file:line" prefix
    };

    void write(LogLevel level, const QVReportingLogCategory& category,
               std::string_view line) override {
        std::lock_guard lock(mutex_);
        lines_.push_back({level, std::string(category.name()), std::string(line)});
    }

    std::vector<Line> lines() const {
        std::lock_guard lock(mutex_);
        return lines_;
    }
    std::size_t count(std::string_view needle) const {
        std::lock_guard lock(mutex_);
        return static_cast<std::size_t>(
            std::count_if(lines_.begin(), lines_.end(),
                          [&](const Line& l) { return l.text.find(needle) != std::string::npos; }));
    }
    bool contains(std::string_view needle) const { return count(needle) > 0; }
    void clear() {
        std::lock_guard lock(mutex_);
        lines_.clear();
    }

  private:
    mutable std::mutex mutex_;
    std::vector<Line> lines_;
};

class ScopedMemoryLog {
  public:
    explicit ScopedMemoryLog(LogLevel level = LogLevel::Debug)
        : sink_(std::make_shared<MemoryLogSink>()),
          previousSink_(logSink()),
          previousLevel_(logLevel()) {
        setLogSink(sink_);
        setLogLevel(level);
    }
    ~ScopedMemoryLog() {
        setLogSink(previousSink_);
        setLogLevel(previousLevel_);
    }
    MemoryLogSink& operator*() { return *sink_; }
    MemoryLogSink* operator->() { return sink_.get(); }

  private:
    std::shared_ptr<MemoryLogSink> sink_;
    std::shared_ptr<LogSink> previousSink_;
    LogLevel previousLevel_;
};

}  // namespace qv::test
