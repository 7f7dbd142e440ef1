// qvreport-export's work: every sink of the state directory read in seq order from the cursor,
// each line published to the stream, the cursor moved and written only past acknowledged lines.
//
// One thread (run()) reads the segments, publishes and writes the cursor and the status; the
// publisher's acknowledgements and failures arrive on the library's threads and only update the
// windows and counters under the lock. At most maxPending lines are in flight in all.
//
// Faults: a failed publish holds every sink's sending for a back-off (250 ms doubling to 4 s,
// back to 250 ms at the next acknowledgement), then a single line goes out until one is
// acknowledged, and each sink resends from its oldest line not acknowledged; servers that cannot be
// reached are retried by the connection for as long as it takes, the lines staying in their
// segments; lines the disk budget removed before they were read are counted as expired and logged.
// After the connection was lost, sending waits (15 s at most) for the stream to have a leader with
// every replica current: a cluster coming back from an outage of all its servers can take and
// acknowledge writes on one history and then settle on another, losing them.
//
// Thread safety: run() on one thread; stop() from any thread (a signal-waiting thread).
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <string_view>

#include "QVReportingExportCursor.h"
#include "QVReportingExportPublisher.h"
#include "QVReportingExportStats.h"
#include "QVReportingExportWindow.h"

namespace qv {
class SinkLineReader;
}

namespace qv::exporter {

struct QVReportingExportSettings {
    std::filesystem::path stateDir;
    std::string device;
    QVReportingExportServerSettings server;
    // Acknowledgements in flight, all sinks together.
    std::size_t maxPending = 4096;
    // A line in flight for longer counts as failed, and so does everything then in flight.
    std::chrono::milliseconds ackWait{5000};
    // Logs the stream's answer to every line: to follow one that went missing.
    bool logAnswers = false;
};

class QVReportingExportShipper {
  public:
    explicit QVReportingExportShipper(QVReportingExportSettings settings);
    ~QVReportingExportShipper();
    QVReportingExportShipper(const QVReportingExportShipper&) = delete;
    QVReportingExportShipper& operator=(const QVReportingExportShipper&) = delete;

    // Ships until stop(), then waits up to the acknowledgement wait for the lines in flight and
    // writes the cursor a last time. Returns the exit status: 0, or 1 when the cursor cannot be
    // read or the connection cannot be set up.
    int run();
    void stop();

  private:
    using Clock = std::chrono::steady_clock;
    struct Sink;

    void discoverSinks();
    void ensureStream(Clock::time_point now);
    // After the connection was lost: whether the stream lacks nothing (waiting is empty: it has
    // a leader with every replica current, or the wait is over); what it waits for is told once.
    bool streamSettled(Clock::time_point now, const std::string& waiting);
    // Reads new lines into the windows; true when any was read.
    bool readLines();
    // Publishes what the windows have waiting; true when any was sent.
    bool sendLines(Clock::time_point now);
    // Past the acknowledgement wait, everything in flight is abandoned and sent again.
    void abandonLateLines(Clock::time_point now);
    void saveCursor();
    void writeStatus();

    void acknowledged(std::string_view sink, std::uint64_t seq, std::uint64_t streamSeq,
                      bool duplicate);
    void failed(std::string_view sink, std::uint64_t seq, const std::string& error);
    // With --log-answers: what the stream answered for one line, and whether it was awaited.
    static void logAnswer(std::string_view sink, std::uint64_t seq, const std::string& answer,
                          bool awaited);
    // REQUIRES: mutex_ held.
    void noteFailureLocked(const std::string& error);

    const QVReportingExportSettings settings_;
    const std::filesystem::path sinksDir_;
    std::unique_ptr<QVReportingExportPublisher> publisher_;

    // Used by run()'s thread only.
    QVReportingExportCursor cursor_;
    QVReportingExportCursor savedCursor_;
    bool streamReady_ = false;
    Clock::time_point streamRetryAt_{};
    Clock::time_point settleBy_{};  // until then the stream must have settled before sending
    std::string settleWaiting_;     // what it waited for when last told
    std::string streamError_;
    std::set<std::string> refusedSinks_;  // names told about once

    std::mutex mutex_;
    std::condition_variable wake_;
    std::map<std::string, std::unique_ptr<Sink>, std::less<>> sinks_;  // GUARDED_BY(mutex_)
    QVReportingExportStats stats_;                                     // GUARDED_BY(mutex_)
    std::size_t inFlight_ = 0;                                         // GUARDED_BY(mutex_)
    Clock::time_point holdUntil_{};                                    // GUARDED_BY(mutex_)
    std::chrono::milliseconds backoff_;                                // GUARDED_BY(mutex_)
    bool probing_ = false;                                             // GUARDED_BY(mutex_)
    bool disconnected_ = false;                                        // GUARDED_BY(mutex_)
    bool stopping_ = false;                                            // GUARDED_BY(mutex_)
};

}  // namespace qv::exporter
