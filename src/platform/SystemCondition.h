// The device's condition at one moment: how hot it runs, whether it saves power, how much memory
// this process holds and how loaded the system is. Read when a session ends, for its summary.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>

namespace qv {

// Thermal pressure, from none to the point where the system must shed load.
enum class ThermalState : std::int32_t {
    Unknown = -1,
    Nominal = 0,
    Fair = 1,
    Serious = 2,
    Critical = 3,
};

class SystemCondition {
  public:
    virtual ~SystemCondition() = default;

    virtual ThermalState thermalState() const = 0;
    virtual bool lowPowerModeEnabled() const = 0;
    // This process's physical memory footprint in bytes; nothing, with error set to the reason,
    // when it cannot be read.
    virtual std::optional<std::uint64_t> ownMemoryFootprint(std::string& error) const = 0;
    // System load averages over 1, 5 and 15 minutes.
    virtual std::array<double, 3> loadAverages() const = 0;
};

}  // namespace qv
