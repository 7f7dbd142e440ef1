// Answers a client's request for a memory snapshot: a "MemoryLog" message (type 19) runs two
// memory listing tools, the per-process listing (command 0, filtered) and the kernel memory
// listing (command 1, every line), each on a detached thread of its own that delivers its text
// through a promise, and writes both texts to the process's default log in blocks of about 512
// bytes cut at line ends ("WIRED LOG BLOCK n").
//
// At most one capture per 5 seconds in the whole process (steady clock; the first request
// passes). The worker exists in "test" sessions (service type 11) on every build and in all
// sessions on internal builds. It is made when its session is, if it applies then; otherwise it
// is tried again at start, when the session's service type is known.
//
// The commands are settings of the defaults suite "com.korvane.qvsound.qvreporting", read at
// every capture:
//   "MemoryLogProcessCommand"  shell command of the per-process listing (default below)
//   "MemoryLogKernelCommand"   shell command of the kernel memory listing (default below)
//   "MemoryLogTimeoutSeconds"  time a tool is given, 0.1 to 60 (default 3)
//   "MemoryLogMaxOutputBytes"  output read from a tool, 4 KiB to 64 MiB (default 1 MiB)
// A tool that outlives its time-out is killed and its output ends there, as it does at the byte
// limit (both noted as lines lost of the "memorylog" sink in QVReportingStats); the handler,
// which runs on the server queue and waits for both texts, is thereby bounded by the time-out
// and a short grace.
//
// Thread safety: handleMessage() runs on the session's queue; the capture threads touch only
// what they are given and the log.
#pragma once

#include <chrono>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/ProcessLauncher.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingSessionWorker.h"

namespace qv {

class Clock;
class PreferenceStore;

// The process's default log: the lines of no particular area (category "default").
const QVReportingLogCategory& QVReportingProcessDefaultLog();

inline constexpr std::string_view QVReportingMemoryLogSuite = "com.korvane.qvsound.qvreporting";
inline constexpr std::string_view QVReportingMemoryLogKeyProcessCommand = "MemoryLogProcessCommand";
inline constexpr std::string_view QVReportingMemoryLogKeyKernelCommand = "MemoryLogKernelCommand";
inline constexpr std::string_view QVReportingMemoryLogKeyTimeoutSeconds = "MemoryLogTimeoutSeconds";
inline constexpr std::string_view QVReportingMemoryLogKeyMaxOutputBytes = "MemoryLogMaxOutputBytes";

class QVReportingSessionMemoryLogWorker final : public QVReportingSessionWorkerConsumerProtocol {
  public:
    static constexpr std::string_view kClassName = "QVReportingSessionMemoryLogWorker";
    static bool startOnInit() { return true; }

    static constexpr std::string_view kLogPrefix = "wiredlog:";
    static constexpr std::chrono::seconds kMinimumInterval{5};
    static constexpr std::size_t kBlockBytes = 512;
    // Per-process listing: ps, one line per process carrying the filter words as labels; exits
    // 127 (not found) when ps is missing.
    static constexpr std::string_view kDefaultProcessCommand =
        "command -v ps >/dev/null || exit 127; "
        "ps -eo pid=,rss=,vsz=,time=,comm= | awk 'NR == 1 { print \"RESOURCE pid phys_mem "
        "phys_footprint cpu_time command (KiB)\" } { c = $5; for (i = 6; i <= NF; i++) c = c "
        "\" \" $i; printf \"%8s phys_mem %10s KiB phys_footprint %10s KiB cpu_time %s %s\\n\", "
        "$1, $2, $3, $4, c }'";
    // Kernel memory listing: one line per slab cache (root only); elsewhere the kernel's memory
    // totals from /proc/meminfo.
    static constexpr std::string_view kDefaultKernelCommand =
        "cat /proc/slabinfo 2>/dev/null || grep -E "
        "'^(Slab|SReclaimable|SUnreclaim|KernelStack|PageTables|VmallocUsed|Percpu):' "
        "/proc/meminfo";

    struct Settings {
        std::string commands[2];
        ProcessPipeLimits limits;
    };

    // Null unless the session is a "test" session or the build an internal one.
    static std::shared_ptr<QVReportingSessionMemoryLogWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    QVReportingSessionMemoryLogWorker(const Clock& clock, const PreferenceStore& preferences,
                                      ProcessLauncher& launcher)
        : clock_(clock), preferences_(preferences), launcher_(launcher) {}

    void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& message) override;
    bool handleRedundantMessages() const override { return true; }

    // The settings as the defaults store gives them now.
    static Settings readSettings(const PreferenceStore& preferences);
    // Whether a line of the per-process listing is kept.
    static bool lineIsKept(std::string_view line);
    // The text cut into blocks: each runs to the first line feed at or after its 512th byte (512
    // bytes when none follows), the last is what remains when fewer than 512 bytes do.
    static std::vector<std::string_view> cutIntoBlocks(std::string_view text);
    // Writes the blocks of text at error level to the default log; nothing for an empty text.
    static void logCapturedText(std::string_view text);

    // For tests only: forgets the last capture, so the next request passes.
    static void TEST_resetRateLimit();

  private:
    // Records now as the last capture unless one was made at most 5 seconds ago.
    static bool rateLimitPasses(const Clock& clock);

    const Clock& clock_;
    const PreferenceStore& preferences_;
    ProcessLauncher& launcher_;
};

}  // namespace qv
