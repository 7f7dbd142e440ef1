#include "platform/linux/LinuxSystemCondition.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <fstream>
#include <string>
#include <utility>
#include <vector>

#include "fakes/TempDirectory.h"

namespace qv {
namespace {

namespace fs = std::filesystem;

// A root directory holding only the files a test writes.
class ALinuxSystemCondition : public ::testing::Test {
  protected:
    void write(const std::string& relative, const std::string& text) {
        const fs::path path = root / relative;
        fs::create_directories(path.parent_path());
        std::ofstream(path) << text;
    }
    // A thermal zone at temperature (millidegrees) with trips of (type, temperature).
    void zone(int n, long temperature, std::vector<std::pair<std::string, long>> trips) {
        const std::string dir = "sys/class/thermal/thermal_zone" + std::to_string(n) + "/";
        write(dir + "temp", std::to_string(temperature) + "\n");
        for (std::size_t i = 0; i < trips.size(); ++i) {
            const std::string trip = dir + "trip_point_" + std::to_string(i);
            write(trip + "_type", trips[i].first + "\n");
            write(trip + "_temp", std::to_string(trips[i].second) + "\n");
        }
    }

    test::TempDirectory root{"qvcondition"};
    LinuxSystemCondition condition{root.path()};
};

TEST_F(ALinuxSystemCondition, TakesTheHottestVerdictOfTheZonesItCanRead) {
    write("sys/class/thermal/thermal_zone9/type", "x86_pkg_temp\n");  // no temperature to read
    EXPECT_EQ(condition.thermalState(), ThermalState::Unknown);

    zone(0, 45000, {{"active", 50000}, {"passive", 80000}, {"critical", 100000}});
    EXPECT_EQ(condition.thermalState(), ThermalState::Nominal);
    zone(1, 50000, {{"active", 50000}});  // a trip counts from its own temperature on
    EXPECT_EQ(condition.thermalState(), ThermalState::Fair);
    zone(2, 85000, {{"passive", 80000}, {"critical", 100000}});
    EXPECT_EQ(condition.thermalState(), ThermalState::Serious);
    zone(3, 101000, {{"active", 60000}, {"hot", 95000}});
    EXPECT_EQ(condition.thermalState(), ThermalState::Critical);
}

TEST_F(ALinuxSystemCondition, ReadsPowerProfileFootprintAndLoadOrSaysWhyNot) {
    std::string error;
    EXPECT_FALSE(condition.ownMemoryFootprint(error));
    EXPECT_FALSE(error.empty());
    write("sys/firmware/acpi/platform_profile", "low-power\n");
    EXPECT_TRUE(condition.lowPowerModeEnabled());
    // The profile daemon's choice wins over the firmware's.
    write("var/lib/power-profiles-daemon/state.ini", "[State]\nProfile=balanced\n");
    EXPECT_FALSE(condition.lowPowerModeEnabled());

    write("proc/self/statm", "1000 25 10 5 0 100 0\n");
    write("proc/loadavg", "0.52 1.50 2.25 1/234 5678\n");
    EXPECT_EQ(condition.ownMemoryFootprint(error),
              std::uint64_t{25} * static_cast<std::uint64_t>(::sysconf(_SC_PAGESIZE)));
    EXPECT_EQ(condition.loadAverages(), (std::array<double, 3>{0.52, 1.5, 2.25}));
    write("proc/self/statm", "garbage\n");
    EXPECT_FALSE(condition.ownMemoryFootprint(error));
}

}  // namespace
}  // namespace qv
