// The daemon's log: twelve categories under the subsystem "com.korvane.qvsound", four levels, and
// one sink chosen at start (the journal, standard error, or a test's memory sink).
//
// Every line starts with the source file's name right-aligned in 25 columns and the line number
// left-aligned in 5 ("%25s:%-5d "). A line whose level is off costs one relaxed atomic load: the
// QVLOG macros test the level before the message is formatted.
//
// Thread safety: everything here may be called from any thread.
#pragma once

#include <fmt/format.h>

#include <atomic>
#include <memory>
#include <string>
#include <string_view>

namespace qv {

enum class LogLevel { Debug = 0, Info = 1, Default = 2, Error = 3 };

inline constexpr std::string_view kQVReportingLogSubsystem = "com.korvane.qvsound";

// One category of the log; made once per process on first use and never destroyed.
class QVReportingLogCategory {
  public:
    explicit constexpr QVReportingLogCategory(std::string_view name) : name_(name) {}
    std::string_view name() const { return name_; }
    std::string_view subsystem() const { return kQVReportingLogSubsystem; }

  private:
    std::string_view name_;
};

const QVReportingLogCategory& QVReportingClientCategory();                 // "qvrc"
const QVReportingLogCategory& QVReportingServiceDelegateCategory();        // "qvrs"
const QVReportingLogCategory& QVReportingSessionCategory();                // "qvrr"
const QVReportingLogCategory& QVReportingSessionConvoReportingCategory();  // "qvri"
const QVReportingLogCategory& QVReportingDriverUtilityCategory();          // "qvrd"
const QVReportingLogCategory& QVReportingTraceCategory();                  // "qvrt"
const QVReportingLogCategory& QVReportingEnergyLogCategory();              // "qvrp"
const QVReportingLogCategory& QVReportingMTXLogCategory();                 // "qvra"
const QVReportingLogCategory& QVReportingICXLogCategory();                 // "qvrb"
const QVReportingLogCategory& QVReportingSummaryLogCategory();             // "qvru"
const QVReportingLogCategory& QVReportingPulsarLogCategory();              // "qvrl"
const QVReportingLogCategory& QVReportingAudioRegistrationCategory();      // "qvrz"

// Where finished lines go. write() may be called from any thread at once.
class LogSink {
  public:
    virtual ~LogSink() = default;
    // line is the whole text, prefix included, without a trailing line break.
    virtual void write(LogLevel level, const QVReportingLogCategory& category,
                       std::string_view line) = 0;
    // Blocks until every line accepted so far has been handed on.
    virtual void flush() {}
};

// Standard error, one line per write.
std::shared_ptr<LogSink> makeStderrLogSink();
// The systemd journal, written from a thread of its own through a bounded buffer so that a stalled
// journal never stalls the caller; lines that find the buffer full are dropped and counted.
std::shared_ptr<LogSink> makeJournalLogSink(std::string syslogIdentifier);
// The journal when standard error is connected to it (JOURNAL_STREAM names it), else stderr.
std::shared_ptr<LogSink> makeDefaultLogSink(std::string syslogIdentifier);

void setLogSink(std::shared_ptr<LogSink> sink);
std::shared_ptr<LogSink> logSink();
void setLogLevel(LogLevel level);
LogLevel logLevel();
inline bool logEnabled(LogLevel level);

// Formats the prefix and hands the line to the sink. Use the QVLOG macros instead.
void logLine(LogLevel level, const QVReportingLogCategory& category, const char* file, int line,
             std::string_view message);

namespace detail {
extern std::atomic<int> gLogLevel;
}

inline bool logEnabled(LogLevel level) {
    return static_cast<int>(level) >= detail::gLogLevel.load(std::memory_order_relaxed);
}

}  // namespace qv

#define QVLOG(level, category, ...)                                                       \
    do {                                                                                  \
        if (::qv::logEnabled(level)) {                                                    \
            ::qv::logLine(level, category, __FILE__, __LINE__, fmt::format(__VA_ARGS__)); \
        }                                                                                 \
    } while (0)

#define QVLOG_DEBUG(category, ...) QVLOG(::qv::LogLevel::Debug, category, __VA_ARGS__)
#define QVLOG_INFO(category, ...) QVLOG(::qv::LogLevel::Info, category, __VA_ARGS__)
#define QVLOG_DEFAULT(category, ...) QVLOG(::qv::LogLevel::Default, category, __VA_ARGS__)
#define QVLOG_ERROR(category, ...) QVLOG(::qv::LogLevel::Error, category, __VA_ARGS__)
