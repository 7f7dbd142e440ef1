#include "session/QVReportingLog.h"

#define SD_JOURNAL_SUPPRESS_LOCATION
#include <syslog.h>
#include <systemd/sd-journal.h>

#include <sys/stat.h>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>

#include "platform/BoundedWriter.h"
#include "session/QVReportingStats.h"

namespace qv {

namespace detail {
std::atomic<int> gLogLevel{static_cast<int>(LogLevel::Info)};
}

namespace {

#define QV_DEFINE_CATEGORY(accessor, name)           \
    const QVReportingLogCategory& accessor() {       \
        static const QVReportingLogCategory c{name}; \
        return c;                                    \
    }

std::mutex gSinkMutex;
std::shared_ptr<LogSink> gSink;  // guarded by gSinkMutex

class StderrLogSink final : public LogSink {
  public:
    void write(LogLevel, const QVReportingLogCategory& category, std::string_view line) override {
        // One fwrite per line keeps lines from different threads whole.
        std::string text = fmt::format("{}: {}\n", category.name(), line);
        std::fwrite(text.data(), 1, text.size(), stderr);
    }
    void flush() override { std::fflush(stderr); }
};

int syslogPriority(LogLevel level) {
    switch (level) {
        case LogLevel::Debug:
            return LOG_DEBUG;
        case LogLevel::Info:
            return LOG_INFO;
        case LogLevel::Default:
            return LOG_NOTICE;
        case LogLevel::Error:
            return LOG_ERR;
    }
    return LOG_INFO;
}

class JournalLogSink final : public LogSink {
  public:
    explicit JournalLogSink(std::string identifier)
        : identifier_(std::move(identifier)), writer_(kCapacity, [this](Line& l) {
              sd_journal_send("MESSAGE=%s", l.text.c_str(), "PRIORITY=%d", l.priority,
                              "SYSLOG_IDENTIFIER=%s", identifier_.c_str(), "QV_CATEGORY=%s",
                              l.category.c_str(), "QV_SUBSYSTEM=%s",
                              std::string(kQVReportingLogSubsystem).c_str(), nullptr);
          }) {}

    void write(LogLevel level, const QVReportingLogCategory& category,
               std::string_view line) override {
        if (!writer_.push(
                Line{std::string(line), std::string(category.name()), syslogPriority(level)})) {
            QVReportingStats::shared().noteLogLineDropped();
        }
    }
    void flush() override { writer_.flush(); }

  private:
    struct Line {
        std::string text;
        std::string category;
        int priority;
    };
    // Lines the journal may fall behind by before new ones are dropped.
    static constexpr std::size_t kCapacity = 8192;
    std::string identifier_;
    BoundedWriter<Line> writer_;
};

std::string_view baseName(const char* path) {
    const char* slash = std::strrchr(path, '/');
    return slash ? slash + 1 : path;
}

}  // namespace

QV_DEFINE_CATEGORY(QVReportingClientCategory, "qvrc")
QV_DEFINE_CATEGORY(QVReportingServiceDelegateCategory, "qvrs")
QV_DEFINE_CATEGORY(QVReportingSessionCategory, "qvrr")
QV_DEFINE_CATEGORY(QVReportingSessionConvoReportingCategory, "qvri")
QV_DEFINE_CATEGORY(QVReportingDriverUtilityCategory, "qvrd")
QV_DEFINE_CATEGORY(QVReportingTraceCategory, "qvrt")
QV_DEFINE_CATEGORY(QVReportingEnergyLogCategory, "qvrp")
QV_DEFINE_CATEGORY(QVReportingMTXLogCategory, "qvra")
QV_DEFINE_CATEGORY(QVReportingICXLogCategory, "qvrb")
QV_DEFINE_CATEGORY(QVReportingSummaryLogCategory, "qvru")
QV_DEFINE_CATEGORY(QVReportingPulsarLogCategory, "qvrl")
QV_DEFINE_CATEGORY(QVReportingAudioRegistrationCategory, "qvrz")

std::shared_ptr<LogSink> makeStderrLogSink() {
    return std::make_shared<StderrLogSink>();
}

std::shared_ptr<LogSink> makeJournalLogSink(std::string syslogIdentifier) {
    return std::make_shared<JournalLogSink>(std::move(syslogIdentifier));
}

std::shared_ptr<LogSink> makeDefaultLogSink(std::string syslogIdentifier) {
    // JOURNAL_STREAM is "device:inode" of the journal's stream; it counts only while stderr is
    // still that stream (a redirected stderr inherits the variable but not the stream).
    if (const char* stream = std::getenv("JOURNAL_STREAM")) {
        struct stat st {};
        unsigned long long dev = 0, ino = 0;
        if (std::sscanf(stream, "%llu:%llu", &dev, &ino) == 2 && fstat(2, &st) == 0 &&
            st.st_dev == dev && st.st_ino == ino) {
            return makeJournalLogSink(std::move(syslogIdentifier));
        }
    }
    return makeStderrLogSink();
}

void setLogSink(std::shared_ptr<LogSink> sink) {
    std::lock_guard lock(gSinkMutex);
    gSink = std::move(sink);
}

std::shared_ptr<LogSink> logSink() {
    std::lock_guard lock(gSinkMutex);
    return gSink;
}

void setLogLevel(LogLevel level) {
    detail::gLogLevel.store(static_cast<int>(level), std::memory_order_relaxed);
}

LogLevel logLevel() {
    return static_cast<LogLevel>(detail::gLogLevel.load(std::memory_order_relaxed));
}

void logLine(LogLevel level, const QVReportingLogCategory& category, const char* file, int line,
             std::string_view message) {
    std::shared_ptr<LogSink> sink = logSink();
    if (!sink) {
        static const std::shared_ptr<LogSink> fallback = makeStderrLogSink();
        sink = fallback;
    }
    sink->write(level, category, fmt::format("{:>25}:{:<5} {}", baseName(file), line, message));
}

}  // namespace qv
