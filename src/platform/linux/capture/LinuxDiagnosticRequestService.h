// The diagnostic-request service on Linux. Every request is recorded in the "diagnostics" sink
// (<stateDir>/sinks/diagnostics.jsonl); a request that asks for a stack sample gets one from perf
// when perf is installed and permitted: `perf record -a -g` of the whole system for a few
// seconds, then `perf report --stdio` of it, both into the Spinlogs directory
// (<stateDir>/logs/Audio/Spinlogs/, one "spinlog-<UTC time>-<request>" group of files each:
// ".perf.data" the raw sample, ".txt" the report, ".log" what perf said).
//
// Sink lines:
//   {"op": "request", "request": N, "domain", "kind", "description", "payload", "options": {...},
//    "sampled": true}                               a sample is being taken
//   {... "sampled": false, "reason": "..."}         recorded only (not asked for, perf missing or
//                                                   refused, or a sample already running)
//   {"op": "sample", "request": N, "ok": true, "data": PATH, "report": PATH, "seconds": S,
//    "dataBytes": B, "reportBytes": B, "reportTruncated": bool}
//   {"op": "sample", "request": N, "ok": false, "error": "..."}
// N numbers the requests of this process from 1.
//
// Bounds: one sample at a time, on the service's own thread (requests that arrive meanwhile are
// recorded and counted as not sampled, so nothing queues); each perf run is stopped at its
// deadline; the raw sample and the report are each bounded in size; only the newest
// maxKeptSpinlogs groups are kept. perf runs confined (see LinuxConfinedProcess.h): no inherited
// descriptors, writes inside the Spinlogs directory only, HOME and TMPDIR pointing there.
//
// perf missing, or refused (perf_event_paranoid without CAP_PERFMON, a kernel without perf
// events, a refusal at run time), is told to the notice callback once, with the reason; from then
// on requests are recorded without a sample. A daemon that does not run as root needs CAP_PERFMON
// (or perf_event_paranoid at most 0) of its own: perf runs with no new privileges, so file
// capabilities on the perf binary are not honoured.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>

#include "platform/DiagnosticRequestService.h"
#include "platform/linux/sinks/JsonlSink.h"

namespace qv {

class Clock;

class LinuxDiagnosticRequestService final : public DiagnosticRequestService {
  public:
    static constexpr std::string_view kSinkName = "diagnostics";

    struct Options {
        std::filesystem::path spinlogsDirectory;
        // perf: a path, or a name looked up in PATH.
        std::string perf = "perf";
        // How long the system is sampled (the extended window when a request asks for it).
        std::chrono::milliseconds sampleWindow{3000};
        std::chrono::milliseconds extendedSampleWindow{10000};
        // After the window, time for perf record to write out its data before it is stopped.
        std::chrono::milliseconds recordGrace{20000};
        // perf report resolves symbols, which can be slow on a large system.
        std::chrono::milliseconds reportTimeout{60000};
        // From SIGINT to SIGKILL when a run overstays.
        std::chrono::milliseconds killGrace{2000};
        // Bounds on one raw sample and one report; older groups beyond maxKeptSpinlogs go.
        std::uint64_t maxSampleBytes = 64ull << 20;
        std::uint64_t maxReportBytes = 16ull << 20;
        std::size_t maxKeptSpinlogs = 16;
        // Told, each once, why samples cannot be taken or are not confined, and of failed runs;
        // runs on the service's thread.
        std::function<void(const std::string& message)> notice;
    };

    struct Counters {
        std::uint64_t requests = 0;
        std::uint64_t sampled = 0;                // handed to perf
        std::uint64_t notSampledBusy = 0;         // a sample was already running
        std::uint64_t notSampledUnavailable = 0;  // perf missing or refused
        std::uint64_t notSampledNotAsked = 0;     // the request wanted no sample
        std::uint64_t samplesFailed = 0;  // perf ran but gave no sample (time-outs included)
    };

    LinuxDiagnosticRequestService(const Clock& clock, std::unique_ptr<JsonlSink> sink,
                                  Options options);
    // Stops a sample in progress (perf is killed), then ends the thread.
    ~LinuxDiagnosticRequestService() override;

    LinuxDiagnosticRequestService(const LinuxDiagnosticRequestService&) = delete;
    LinuxDiagnosticRequestService& operator=(const LinuxDiagnosticRequestService&) = delete;

    void request(std::string_view domain, std::string_view kind, std::string_view description,
                 const Dictionary& payload, const DiagnosticRequestOptions& options) override;

    // Blocks until the sample in progress, if any, is done, and every line is in the file.
    void flush();
    Counters counters() const;
    const JsonlSink& sink() const { return *sink_; }

    // Nothing when perf (a path, or a name looked up in PATH) can sample the whole system from
    // this process, else why not.
    static std::optional<std::string> perfUnavailableReason(const std::string& perf);

  private:
    struct Job {
        std::int64_t number = 0;
        DiagnosticRequestOptions options;
    };

    void run();
    // The service's thread only, from here down.
    void sample(const Job& job);
    void finish(std::int64_t number, Dictionary line, bool ok);
    void pruneOldSpinlogs();
    void notice(const std::string& message);

    const Clock& clock_;
    const std::unique_ptr<JsonlSink> sink_;
    const Options options_;

    mutable std::mutex mutex_;
    std::condition_variable wake_;
    std::condition_variable idle_;
    std::optional<Job> job_;               // guarded by mutex_: the one sample waiting to start
    bool busy_ = false;                    // guarded by mutex_: a sample is waiting or running
    bool stopping_ = false;                // guarded by mutex_
    std::int64_t nextRequest_ = 1;         // guarded by mutex_
    std::optional<std::string> unusable_;  // guarded by mutex_: why perf cannot sample
    bool probed_ = false;                  // guarded by mutex_
    Counters counters_;                    // guarded by mutex_

    std::string lastNotice_;           // the service's thread only
    bool confinementNoticed_ = false;  // the service's thread only
    // Readable once the service stops: a running perf is killed.
    int cancelFd_ = -1;
    // Last: runs once the members above exist.
    std::thread thread_;
};

}  // namespace qv
