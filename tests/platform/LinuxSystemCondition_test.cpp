#include "platform/linux/system/LinuxSystemCondition.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <fstream>
#include <string>

#include "fakes/TempDirectory.h"

namespace qv {
namespace {

TEST(ALinuxSystemCondition, ReadsTheKernelFilesUnderItsRoot) {
    test::TempDirectory root{"qvcondition"};
    const auto write = [&](const std::string& relative, const std::string& text) {
        std::filesystem::create_directories((root / relative).parent_path());
        std::ofstream(root / relative) << text;
    };
    LinuxSystemCondition condition{root.path()};
    std::string error;
    EXPECT_EQ(condition.thermalState(), ThermalState::Unknown);
    EXPECT_FALSE(condition.ownMemoryFootprint(error));

    // The hottest zone wins; a trip counts from its own temperature on.
    const std::string zone = "sys/class/thermal/thermal_zone";
    write(zone + "0/temp", "45000");
    write(zone + "0/trip_point_0_type", "active");
    write(zone + "0/trip_point_0_temp", "50000");
    EXPECT_EQ(condition.thermalState(), ThermalState::Nominal);
    write(zone + "1/temp", "80000");
    write(zone + "1/trip_point_0_type", "passive");
    write(zone + "1/trip_point_0_temp", "80000");
    EXPECT_EQ(condition.thermalState(), ThermalState::Serious);

    // The profile daemon's choice wins over the firmware's.
    write("sys/firmware/acpi/platform_profile", "low-power\n");
    EXPECT_TRUE(condition.lowPowerModeEnabled());
    write("var/lib/power-profiles-daemon/state.ini", "[State]\nProfile=balanced\n");
    EXPECT_FALSE(condition.lowPowerModeEnabled());

    write("proc/self/statm", "1000 25 10 5 0 100 0\n");
    write("proc/loadavg", "0.52 1.50 2.25 1/234 5678\n");
    EXPECT_EQ(condition.ownMemoryFootprint(error),
              std::uint64_t{25} * static_cast<std::uint64_t>(::sysconf(_SC_PAGESIZE)));
    EXPECT_EQ(condition.loadAverages(), (std::array<double, 3>{0.52, 1.5, 2.25}));
}

}  // namespace
}  // namespace qv
