// A cap on the bytes a set of files may take on disk: past it, the oldest go first. The sinks'
// closed segments share one (all sinks together; the current segments are never in it), and so do
// the summary files and the stack samples under logs/Audio/.
//
// The files are found afresh on every enforce() by a lister the owner gives: each file belongs to
// a group (a sink's name, say) and has a rank inside it (a closed segment's first seq). Files of
// one group go in rank order; across groups the one whose next file was modified longest ago goes
// first.
//
// Thread safety: enforce() may be called from any thread; calls are serialised, so two sinks that
// close a segment at once do not remove more than needed. The callbacks run on the caller's
// thread, under that serialisation.
#pragma once

#include <cstdint>
#include <ctime>
#include <filesystem>
#include <functional>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

namespace qv {

class DiskBudget {
  public:
    struct File {
        std::filesystem::path path;
        std::string group;
        std::uint64_t rank = 0;  // order inside the group, oldest lowest
        std::uint64_t bytes = 0;
        std::timespec modified{};
    };
    struct Callbacks {
        // One file removed to keep within the budget.
        std::function<void(std::string_view group, std::uint64_t bytes)> removed;
        // A line worth logging: what was removed, or what could not be.
        std::function<void(const std::string& message)> problem;
    };

    // label names the budget in log lines ("sinks", "logs/Audio/Reporting").
    DiskBudget(std::string label, std::uint64_t maxBytes, std::function<std::vector<File>()> list,
               Callbacks callbacks);

    DiskBudget(const DiskBudget&) = delete;
    DiskBudget& operator=(const DiskBudget&) = delete;

    // Removes the oldest files while the total passes the budget. Returns the bytes removed.
    std::uint64_t enforce();

    std::uint64_t maxBytes() const { return maxBytes_; }

    // A lister for the regular files directly in a directory, one group, ranked by modification
    // time; names starting with "." (files being written) are left alone.
    static std::function<std::vector<File>()> filesIn(std::filesystem::path directory,
                                                      std::string group);
    // A lister for the closed segments of every sink in a sinks directory, grouped by sink.
    static std::function<std::vector<File>()> closedSinkSegmentsIn(std::filesystem::path sinksDir);

  private:
    const std::string label_;
    const std::uint64_t maxBytes_;
    const std::function<std::vector<File>()> list_;
    const Callbacks callbacks_;
    std::mutex mutex_;  // serialises enforce()
};

}  // namespace qv
