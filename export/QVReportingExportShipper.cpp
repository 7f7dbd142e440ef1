#include "QVReportingExportShipper.h"

#include <algorithm>
#include <charconv>
#include <fstream>
#include <iostream>
#include <optional>
#include <vector>

#include "QVReportingExportFiles.h"
#include "platform/SinkSegments.h"

namespace qv::exporter {

namespace {

using namespace std::chrono_literals;

constexpr auto kFirstBackoff = 250ms;
constexpr auto kLongestBackoff = 4000ms;
// Nothing new on disk: look again after this (the daemon writes a line within 100 ms too).
constexpr auto kIdlePoll = 100ms;
constexpr auto kDiscoveryInterval = 1s;
constexpr auto kStreamRetryInterval = 1s;
// After the connection was lost, how long sending waits for the stream's replicas to settle.
constexpr auto kSettleLimit = 15s;
constexpr auto kSettleInterval = 250ms;
// The cursor is written at most this often; a crash resends at most this much, which the
// stream refuses as duplicates.
constexpr auto kCursorInterval = 1s;
constexpr auto kStatusInterval = 1s;
// The tail of a segment read to find its last line's seq for the lag.
constexpr std::size_t kTailBytes = 64 * 1024;

void log(const std::string& line) {
    std::cerr << "qvreport-export: " << line << std::endl;
}

// A steady time point in seconds, as the windows keep it.
double seconds(std::chrono::steady_clock::time_point time) {
    return std::chrono::duration<double>(time.time_since_epoch()).count();
}

double wallClock() {
    return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch())
        .count();
}

// A sink name is one token of a subject: no '.', '*', '>' or blanks.
bool isSubjectToken(std::string_view sink) {
    return !sink.empty() && std::all_of(sink.begin(), sink.end(), [](char c) {
        return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
               c == '_' || c == '-';
    });
}

// The "time" of a sink line (its first member), 0 when it has none.
double lineTime(std::string_view line) {
    constexpr std::string_view kPrefix = "{\"time\":";
    if (!line.starts_with(kPrefix)) {
        return 0;
    }
    double time = 0;
    const char* begin = line.data() + kPrefix.size();
    std::from_chars(begin, line.data() + line.size(), time);
    return time;
}

// The seq of the newest whole line on disk, from the tail of the newest segment that has one.
std::uint64_t lastSeqOnDisk(const std::filesystem::path& sinksDir, const std::string& sink) {
    const auto segments = QVReportingListSinkSegments(sinksDir, sink);
    for (auto segment = segments.rbegin(); segment != segments.rend(); ++segment) {
        std::ifstream in(segment->path, std::ios::binary | std::ios::ate);
        const auto size = static_cast<std::int64_t>(in.tellg());
        if (!in || size <= 0) {
            continue;
        }
        const auto from = std::max<std::int64_t>(0, size - static_cast<std::int64_t>(kTailBytes));
        std::string tail(static_cast<std::size_t>(size - from), '\0');
        in.seekg(from);
        in.read(tail.data(), static_cast<std::streamsize>(tail.size()));
        tail.resize(static_cast<std::size_t>(in.gcount()));
        auto end = tail.rfind('\n');
        while (end != std::string::npos && end > 0) {
            const auto begin = tail.rfind('\n', end - 1);
            const auto start = begin == std::string::npos ? 0 : begin + 1;
            if (const auto seq =
                    QVReportingSinkLineSeq(std::string_view(tail).substr(start, end - start))) {
                return *seq;
            }
            if (begin == std::string::npos) {
                break;
            }
            end = begin;
        }
    }
    return 0;
}

}  // namespace

struct QVReportingExportShipper::Sink {
    Sink(const std::filesystem::path& sinksDir, const std::string& name, std::uint64_t cursor)
        : reader(sinksDir, name, cursor), window(cursor) {}
    SinkLineReader reader;           // run()'s thread only
    QVReportingExportWindow window;  // GUARDED_BY(mutex_)
};

QVReportingExportShipper::QVReportingExportShipper(QVReportingExportSettings settings)
    : settings_(std::move(settings)),
      sinksDir_(settings_.stateDir / "sinks"),
      backoff_(kFirstBackoff) {
    stats_.device = settings_.device;
    stats_.stream = settings_.server.stream;
    stats_.servers = settings_.server.urls;
    stats_.started = wallClock();
    QVReportingExportPublisher::Callbacks callbacks;
    callbacks.acknowledged = [this](std::string_view sink, std::uint64_t seq,
                                    std::uint64_t streamSeq, bool duplicate) {
        acknowledged(sink, seq, streamSeq, duplicate);
    };
    callbacks.failed = [this](std::string_view sink, std::uint64_t seq, const std::string& error) {
        failed(sink, seq, error);
    };
    callbacks.connection = [this](bool connected) {
        std::lock_guard lock(mutex_);
        stats_.connected = connected;
        disconnected_ = disconnected_ || !connected;
        wake_.notify_all();
    };
    publisher_ = std::make_unique<QVReportingExportPublisher>(settings_.server, settings_.device,
                                                              std::move(callbacks));
}

QVReportingExportShipper::~QVReportingExportShipper() {
    // The connection goes first: no callback may find the windows gone.
    publisher_.reset();
}

void QVReportingExportShipper::stop() {
    std::lock_guard lock(mutex_);
    stopping_ = true;
    wake_.notify_all();
}

int QVReportingExportShipper::run() {
    std::string error;
    cursor_ = QVReportingExportCursor::load(QVReportingExportCursorPath(settings_.stateDir), error);
    if (!error.empty()) {
        log(error +
            "; not starting, so as not to resend every line on disk (move it away to "
            "start from the oldest line)");
        return 1;
    }
    savedCursor_ = cursor_;
    if (error = publisher_->start(); !error.empty()) {
        log(error);
        return 1;
    }
    log("shipping " + sinksDir_.string() + " as device " + settings_.device + " to " +
        settings_.server.urls + ", stream " + settings_.server.stream);
    auto nextDiscovery = Clock::time_point{};
    auto nextCursor = Clock::now() + kCursorInterval;
    auto nextStatus = Clock::time_point{};
    for (;;) {
        {
            std::lock_guard lock(mutex_);
            if (stopping_) {
                break;
            }
        }
        auto now = Clock::now();
        if (now >= nextDiscovery) {
            discoverSinks();
            nextDiscovery = now + kDiscoveryInterval;
        }
        ensureStream(now);
        abandonLateLines(now);
        const bool read = readLines();
        const bool sent = sendLines(now);
        now = Clock::now();
        if (now >= nextCursor) {
            saveCursor();
            nextCursor = now + kCursorInterval;
        }
        if (now >= nextStatus) {
            writeStatus();
            nextStatus = now + kStatusInterval;
        }
        if (read || sent) {
            continue;
        }
        std::unique_lock lock(mutex_);
        auto until = now + kIdlePoll;
        if (holdUntil_ > now) {
            until = std::min(until, holdUntil_);
        }
        wake_.wait_until(lock, until);
    }
    publisher_->drain(settings_.ackWait);
    saveCursor();
    writeStatus();
    log("stopped");
    return 0;
}

void QVReportingExportShipper::discoverSinks() {
    for (const auto& name : QVReportingListSinks(sinksDir_)) {
        if (sinks_.contains(name)) {
            continue;
        }
        if (!isSubjectToken(name)) {
            if (refusedSinks_.insert(name).second) {
                log("sink " + name + " is not shipped: its name cannot be a subject token");
            }
            continue;
        }
        auto sink = std::make_unique<Sink>(sinksDir_, name, cursor_.seq(name));
        std::lock_guard lock(mutex_);
        sinks_.emplace(name, std::move(sink));
        stats_.sinks[name];
    }
}

void QVReportingExportShipper::ensureStream(Clock::time_point now) {
    {
        std::lock_guard lock(mutex_);
        if (disconnected_) {
            disconnected_ = false;
            streamReady_ = false;
            stats_.streamReady = false;
            settleBy_ = now + kSettleLimit;
        }
    }
    if (streamReady_ || now < streamRetryAt_ || !publisher_->connected()) {
        return;
    }
    std::string unsettled;
    const std::string error = publisher_->ensureStream(now < settleBy_ ? &unsettled : nullptr);
    if (error.empty() && !streamSettled(now, unsettled)) {
        streamRetryAt_ = now + kSettleInterval;
        return;
    }
    streamReady_ = error.empty();
    if (!streamReady_) {
        streamRetryAt_ = now + kStreamRetryInterval;
        if (error != streamError_) {
            log(error + " (trying again every second)");
        }
    } else if (!streamError_.empty()) {
        log("stream " + settings_.server.stream + " ready");
    }
    streamError_ = error;
    std::lock_guard lock(mutex_);
    stats_.streamReady = streamReady_;
    if (!error.empty()) {
        stats_.lastError = error;
    }
}

bool QVReportingExportShipper::streamSettled(Clock::time_point now, const std::string& waiting) {
    if (!waiting.empty() && waiting != settleWaiting_) {
        const auto left = std::chrono::duration_cast<std::chrono::seconds>(settleBy_ - now);
        log("stream " + settings_.server.stream + ": waiting for " + waiting + " before sending, " +
            std::to_string(left.count()) + " s at most");
    } else if (waiting.empty() && !settleWaiting_.empty()) {
        log("stream " + settings_.server.stream +
            (now < settleBy_ ? ": settled" : ": not settled in time") + ", sending again");
    }
    settleWaiting_ = waiting;
    return waiting.empty();
}

bool QVReportingExportShipper::readLines() {
    bool any = false;
    for (auto& [name, sink] : sinks_) {
        std::size_t room = 0;
        {
            std::lock_guard lock(mutex_);
            room = settings_.maxPending - std::min(settings_.maxPending, sink->window.size());
        }
        std::vector<SinkLineReader::Line> lines;
        while (lines.size() < room) {
            auto line = sink->reader.next();
            if (!line) {
                break;
            }
            lines.push_back(std::move(*line));
        }
        if (lines.empty()) {
            continue;
        }
        any = true;
        std::lock_guard lock(mutex_);
        for (auto& line : lines) {
            const std::uint64_t before = sink->window.last();
            const double time = lineTime(line.text);
            if (const auto missing = sink->window.add(line.seq, std::move(line.text), time)) {
                stats_.sinks[name].expired += missing;
                log(name + ": " + std::to_string(missing) +
                    " lines expired before they were sent (seq " + std::to_string(before + 1) +
                    " to " + std::to_string(line.seq - 1) + ")");
            }
        }
    }
    return any;
}

bool QVReportingExportShipper::sendLines(Clock::time_point now) {
    if (!streamReady_ || !publisher_->connected()) {
        return false;
    }
    bool any = false;
    for (auto& [name, sink] : sinks_) {
        std::vector<QVReportingExportWindow::Outgoing> batch;
        {
            std::lock_guard lock(mutex_);
            if (now < holdUntil_ || stopping_) {
                return any;
            }
            // After a failure one line goes out alone until the stream acknowledges again, so
            // that a recovering cluster is not answered with a whole window of refusals.
            const std::size_t room =
                probing_ ? (inFlight_ == 0 ? 1 : 0)
                         : settings_.maxPending - std::min(settings_.maxPending, inFlight_);
            batch = sink->window.take(room, seconds(now));
            inFlight_ += batch.size();
            auto& counters = stats_.sinks[name];
            counters.sent += batch.size();
            counters.retried += static_cast<std::uint64_t>(std::count_if(
                batch.begin(), batch.end(), [](const auto& line) { return line.retry; }));
        }
        for (const auto& line : batch) {
            if (const std::string error = publisher_->publish(name, line.seq, line.text);
                !error.empty()) {
                failed(name, line.seq, error);
            }
        }
        any = any || !batch.empty();
    }
    return any;
}

void QVReportingExportShipper::abandonLateLines(Clock::time_point now) {
    const double late = seconds(now - settings_.ackWait);
    {
        std::lock_guard lock(mutex_);
        if (std::none_of(sinks_.begin(), sinks_.end(), [&](const auto& sink) {
                const auto sentAt = sink.second->window.oldestSentAt();
                return sentAt && *sentAt < late;
            })) {
            return;
        }
    }
    // The library forgets them first, so that no acknowledgement arrives for a line the windows
    // have already put back to be sent again.
    publisher_->abandonPending();
    std::lock_guard lock(mutex_);
    for (auto& [name, sink] : sinks_) {
        const auto failed = sink->window.failAll();
        stats_.sinks[name].failed += failed;
        inFlight_ -= failed;
        if (settings_.logAnswers && failed > 0) {
            log(name + ": " + std::to_string(failed) +
                " lines in flight given up on, to be sent again from seq " +
                std::to_string(sink->window.cursor() + 1));
        }
    }
    noteFailureLocked("no acknowledgement within " + std::to_string(settings_.ackWait.count()) +
                      " ms");
}

void QVReportingExportShipper::acknowledged(std::string_view name, std::uint64_t seq,
                                            std::uint64_t streamSeq, bool duplicate) {
    std::lock_guard lock(mutex_);
    const auto sink = sinks_.find(name);
    const bool awaited = sink != sinks_.end() && sink->second->window.acknowledge(seq);
    if (settings_.logAnswers) {
        logAnswer(name, seq,
                  "stored as stream message " + std::to_string(streamSeq) +
                      (duplicate ? " (a duplicate)" : ""),
                  awaited);
    }
    if (!awaited) {
        return;
    }
    auto& counters = stats_.sinks[sink->first];
    ++counters.acknowledged;
    counters.duplicates += duplicate ? 1 : 0;
    backoff_ = kFirstBackoff;
    if (probing_) {
        probing_ = false;
        wake_.notify_all();
    }
    // Wake the sender once half the room is free, not at every acknowledgement.
    if (inFlight_-- == settings_.maxPending / 2 + 1) {
        wake_.notify_all();
    }
}

void QVReportingExportShipper::failed(std::string_view name, std::uint64_t seq,
                                      const std::string& error) {
    std::lock_guard lock(mutex_);
    const auto sink = sinks_.find(name);
    const bool awaited = sink != sinks_.end() && sink->second->window.fail(seq);
    if (settings_.logAnswers) {
        logAnswer(name, seq, "failed: " + error, awaited);
    }
    if (!awaited) {
        return;
    }
    ++stats_.sinks[sink->first].failed;
    --inFlight_;
    noteFailureLocked(error);
}

void QVReportingExportShipper::logAnswer(std::string_view sink, std::uint64_t seq,
                                         const std::string& answer, bool awaited) {
    log(std::string(sink) + " " + std::to_string(seq) + ": " + answer +
        (awaited ? "" : "; not awaited any more, ignored"));
}

void QVReportingExportShipper::noteFailureLocked(const std::string& error) {
    stats_.lastError = error;
    probing_ = true;
    const auto now = Clock::now();
    // One back-off step per round of failures, however many lines failed in it.
    if (now >= holdUntil_) {
        holdUntil_ = now + backoff_;
        log("publishing failed (" + error + "); sending again in " +
            std::to_string(backoff_.count()) + " ms");
        backoff_ = std::min(backoff_ * 2,
                            std::chrono::duration_cast<std::chrono::milliseconds>(kLongestBackoff));
    }
    wake_.notify_all();
}

void QVReportingExportShipper::saveCursor() {
    {
        std::lock_guard lock(mutex_);
        for (const auto& [name, sink] : sinks_) {
            cursor_.advance(name, sink->window.cursor());
        }
    }
    if (cursor_ == savedCursor_) {
        return;
    }
    if (const std::string error = cursor_.save(QVReportingExportCursorPath(settings_.stateDir));
        !error.empty()) {
        log(error);
        return;
    }
    savedCursor_ = cursor_;
}

void QVReportingExportShipper::writeStatus() {
    // The lag needs each sink's newest line on disk, read without the lock.
    std::map<std::string, std::uint64_t> onDisk;
    for (const auto& [name, sink] : sinks_) {
        onDisk[name] = lastSeqOnDisk(sinksDir_, name);
    }
    const double now = wallClock();
    std::string text;
    {
        std::lock_guard lock(mutex_);
        for (const auto& [name, sink] : sinks_) {
            auto& counters = stats_.sinks[name];
            counters.cursor = sink->window.cursor();
            counters.lastSeq = std::max(onDisk[name], sink->window.last());
            const auto oldest = sink->window.oldestTime();
            counters.lagSeconds = oldest && *oldest > 0 ? std::max(0.0, now - *oldest) : 0.0;
        }
        text = stats_.toJson(now);
    }
    if (const std::string error = QVReportingExportWriteFileAtomically(
            QVReportingExportStatusPath(settings_.stateDir), text);
        !error.empty()) {
        log(error);
    }
}

}  // namespace qv::exporter
