// The device's condition on Linux, read from the kernel's files under a root directory ("/" in
// the daemon, a prepared tree in tests):
// - thermal state: every thermal zone under sys/class/thermal whose temperature can be read is
//   set against its own trip points: at or above an "active" trip Fair (fans run), a "passive"
//   trip Serious (the kernel throttles), a "hot" or "critical" trip Critical; below every trip
//   Nominal. The hottest verdict of all zones wins; Unknown when no zone can be read.
// - low-power mode: the power-profile daemon's saved profile is "power-saver", or, without it,
//   the firmware's platform profile is "low-power".
// - memory footprint: the resident set size of proc/self/statm.
// - load averages: proc/loadavg.
#pragma once

#include <filesystem>

#include "platform/SystemCondition.h"

namespace qv {

class LinuxSystemCondition final : public SystemCondition {
  public:
    explicit LinuxSystemCondition(std::filesystem::path root = "/") : root_(std::move(root)) {}

    ThermalState thermalState() const override;
    bool lowPowerModeEnabled() const override;
    std::optional<std::uint64_t> ownMemoryFootprint(std::string& error) const override;
    std::array<double, 3> loadAverages() const override;

  private:
    std::filesystem::path root_;
};

}  // namespace qv
