#include "platform/linux/system/LinuxSystemCondition.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fstream>
#include <system_error>

namespace qv {

namespace {

std::optional<std::string> readFirstLine(const std::filesystem::path& path) {
    std::ifstream in(path);
    std::string line;
    if (!in || !std::getline(in, line)) {
        return std::nullopt;
    }
    return line;
}

std::optional<long long> readInteger(const std::filesystem::path& path) {
    const auto line = readFirstLine(path);
    if (!line) {
        return std::nullopt;
    }
    try {
        return std::stoll(*line);
    } catch (const std::exception&) {
        return std::nullopt;
    }
}

ThermalState verdictOfTripType(const std::string& type) {
    if (type == "active") {
        return ThermalState::Fair;
    }
    if (type == "passive") {
        return ThermalState::Serious;
    }
    if (type == "hot" || type == "critical") {
        return ThermalState::Critical;
    }
    return ThermalState::Nominal;
}

// One zone's verdict, or nothing when its temperature cannot be read.
std::optional<ThermalState> zoneVerdict(const std::filesystem::path& zone) {
    const auto temperature = readInteger(zone / "temp");
    if (!temperature) {
        return std::nullopt;
    }
    ThermalState verdict = ThermalState::Nominal;
    for (int trip = 0;; ++trip) {
        const std::string prefix = "trip_point_" + std::to_string(trip);
        const auto tripTemperature = readInteger(zone / (prefix + "_temp"));
        const auto type = readFirstLine(zone / (prefix + "_type"));
        if (!tripTemperature || !type) {
            break;
        }
        if (*temperature >= *tripTemperature) {
            verdict = std::max(verdict, verdictOfTripType(*type));
        }
    }
    return verdict;
}

}  // namespace

ThermalState LinuxSystemCondition::thermalState() const {
    std::error_code ec;
    std::filesystem::directory_iterator zones(root_ / "sys/class/thermal", ec);
    if (ec) {
        return ThermalState::Unknown;
    }
    ThermalState hottest = ThermalState::Unknown;
    for (const auto& entry : zones) {
        if (entry.path().filename().string().rfind("thermal_zone", 0) != 0) {
            continue;
        }
        if (const auto verdict = zoneVerdict(entry.path())) {
            hottest = std::max(hottest, *verdict);
        }
    }
    return hottest;
}

bool LinuxSystemCondition::lowPowerModeEnabled() const {
    if (std::ifstream state(root_ / "var/lib/power-profiles-daemon/state.ini"); state) {
        std::string line;
        while (std::getline(state, line)) {
            if (line.rfind("Profile=", 0) == 0) {
                return line.substr(8) == "power-saver";
            }
        }
        return false;
    }
    const auto profile = readFirstLine(root_ / "sys/firmware/acpi/platform_profile");
    return profile && *profile == "low-power";
}

std::optional<std::uint64_t> LinuxSystemCondition::ownMemoryFootprint(std::string& error) const {
    std::ifstream statm(root_ / "proc/self/statm");
    if (!statm) {
        error = std::strerror(errno);
        return std::nullopt;
    }
    std::uint64_t sizePages = 0, residentPages = 0;
    if (!(statm >> sizePages >> residentPages)) {
        error = "unreadable memory statistics";
        return std::nullopt;
    }
    return residentPages * static_cast<std::uint64_t>(::sysconf(_SC_PAGESIZE));
}

std::array<double, 3> LinuxSystemCondition::loadAverages() const {
    std::array<double, 3> averages{0.0, 0.0, 0.0};
    std::ifstream in(root_ / "proc/loadavg");
    in >> averages[0] >> averages[1] >> averages[2];
    return in ? averages : std::array<double, 3>{0.0, 0.0, 0.0};
}

}  // namespace qv
