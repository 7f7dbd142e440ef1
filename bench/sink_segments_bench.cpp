// Disk used by the sinks after 2 GiB of sink lines, with the daemon's default segments (64 MiB,
// a day) and budget (1 GiB of closed segments): lines of about 1 KiB, shaped like analytics
// events, go through a real JsonlSink into a temporary state directory, as fast as the sink takes
// them (a line the full buffer refuses waits for a flush and is appended again, so none is lost).
// Reported: bytes on disk, closed segments, the bytes the budget expired, and the sink's write
// rate beside the baseline of the same run: plain write(2) calls of the same bytes, already
// formatted, 256 KiB at a time, to one file in the same directory.
//
//   build/release/bench/qv_sink_segments_bench [--bytes N]
#include <fcntl.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>

#include "platform/SinkSegments.h"
#include "platform/linux/sinks/DiskBudget.h"
#include "platform/linux/sinks/JsonlSink.h"
#include "platform/linux/system/LinuxClock.h"

namespace {

namespace fs = std::filesystem;
using namespace qv;
using Seconds = std::chrono::duration<double>;

struct Usage {
    std::uint64_t bytes = 0;
    std::size_t closed = 0;
};

Usage diskUsage(const fs::path& sinks) {
    Usage usage;
    for (const auto& segment : QVReportingListSinkSegments(sinks, "analytics")) {
        usage.bytes += fs::file_size(segment.path);
        usage.closed += segment.current ? 0 : 1;
    }
    return usage;
}

double mibPerSecond(std::uint64_t bytes, double seconds) {
    return static_cast<double>(bytes) / (1 << 20) / seconds;
}

}  // namespace

int main(int argc, char** argv) {
    std::uint64_t target = std::uint64_t{2} << 30;
    if (argc == 3 && std::strcmp(argv[1], "--bytes") == 0) {
        target = std::stoull(argv[2]);
    }
    char pattern[] = "/var/tmp/qv-sink-bench.XXXXXX";
    if (::mkdtemp(pattern) == nullptr) {
        std::perror("mkdtemp");
        return 1;
    }
    const fs::path state = pattern;
    const fs::path sinks = state / "sinks";

    LinuxClock clock;
    std::uint64_t expired = 0;
    std::atomic<std::uint64_t> lost{0};
    const SinkSegmentPolicy policy{
        SinkSegmentPolicy::kDefaultSegmentBytes, SinkSegmentPolicy::kDefaultSegmentSeconds,
        std::make_shared<DiskBudget>(
            "sinks", std::uint64_t{1} << 30, DiskBudget::closedSinkSegmentsIn(sinks),
            DiskBudget::Callbacks{[&](std::string_view, std::uint64_t bytes) { expired += bytes; },
                                  nullptr})};
    const Dictionary payload{
        {"reporterID", 4242}, {"service", "telephony"}, {"pad", std::string(900, 'p')}};
    std::string sample;  // one formatted line, for the count and the baseline
    std::uint64_t lines = 0;
    double sinkSeconds = 0;
    {
        JsonlSink sink(state.string(), "analytics", clock,
                       SinkCallbacks{[&](std::string_view) { ++lost; }, nullptr, nullptr, nullptr},
                       JsonlSink::kDefaultCapacity, policy);
        sink.append({{"event", "com.korvane.qvsound.Playback.Start"}, {"payload", payload}});
        sink.flush();
        std::getline(std::ifstream(sinks / "analytics.jsonl"), sample);
        sample += '\n';
        const std::uint64_t count = target / sample.size();
        const auto start = std::chrono::steady_clock::now();
        for (lines = 1; lines < count; ++lines) {
            Dictionary line{{"event", "com.korvane.qvsound.Playback.Start"}, {"payload", payload}};
            while (!sink.append(line)) {
                sink.flush();
                --lost;  // refused for a full buffer and appended again: not lost
            }
        }
        sink.flush();
        sinkSeconds = Seconds(std::chrono::steady_clock::now() - start).count();
    }
    const Usage usage = diskUsage(sinks);
    const std::uint64_t written = usage.bytes + expired;

    // Baseline: the same bytes, already formatted, with plain write(2) calls.
    std::string chunk;
    while (chunk.size() + sample.size() <= 256 * 1024) {
        chunk += sample;
    }
    const fs::path plain = state / "plain.jsonl";
    const int fd = ::open(plain.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    const auto start = std::chrono::steady_clock::now();
    std::uint64_t plainBytes = 0;
    while (plainBytes + sample.size() * 2 <= written) {
        const std::size_t n = std::min<std::uint64_t>(chunk.size(), written - plainBytes);
        if (::write(fd, chunk.data(), n) != static_cast<ssize_t>(n)) {
            std::perror("write");
            return 1;
        }
        plainBytes += n;
    }
    ::fsync(fd);  // not counted below: the sink does not sync either
    const double plainSeconds = Seconds(std::chrono::steady_clock::now() - start).count();
    ::close(fd);
    fs::remove(plain);

    std::printf("sink lines written       %llu lines of %zu bytes, %.2f GiB in all (%llu lost)\n",
                static_cast<unsigned long long>(lines), sample.size(),
                static_cast<double>(written) / (1 << 30),
                static_cast<unsigned long long>(lost.load()));
    std::printf(
        "on disk after            %.1f MiB: %zu closed segments of 64 MiB and the current"
        " one\n",
        static_cast<double>(usage.bytes) / (1 << 20), usage.closed);
    std::printf("sink_bytes_expired       %llu (%.1f MiB)\n",
                static_cast<unsigned long long>(expired), static_cast<double>(expired) / (1 << 20));
    std::printf("JsonlSink (format+write) %.0f MiB/s\n", mibPerSecond(written, sinkSeconds));
    std::printf("plain write(2) baseline  %.0f MiB/s (%.2f GiB of the same bytes)\n",
                mibPerSecond(plainBytes, plainSeconds),
                static_cast<double>(plainBytes) / (1 << 30));
    std::printf("ratio sink / baseline    %.2f\n",
                mibPerSecond(written, sinkSeconds) / mibPerSecond(plainBytes, plainSeconds));
    fs::remove_all(state);
    return 0;
}
