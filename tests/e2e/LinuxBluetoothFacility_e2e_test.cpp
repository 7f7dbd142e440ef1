// The Linux Bluetooth facility against a BlueZ on a private bus: a dbus-daemon of its own and
// python-dbusmock's bluez5 template, driven through its mock interface as a test bench would
// drive a radio. No adapter is needed.
#include "platform/linux/bluetooth/LinuxBluetoothFacility.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <fstream>
#include <string>

#include <sdbus-c++/sdbus-c++.h>

#include "fakes/Notes.h"
#include "fakes/TempDirectory.h"
#include "fakes/WaitUntil.h"

namespace qv {
namespace {

using namespace std::chrono_literals;

constexpr const char* kMock = "org.bluez.Mock";

// A private bus and, when asked, a mock BlueZ on it; both ended with the object.
class PrivateBus {
  public:
    PrivateBus() {
        FILE* bus = popen("dbus-daemon --session --fork --print-address=1 --print-pid=1", "r");
        char line[512] = {}, pid[32] = {};
        const bool read = bus && fgets(line, sizeof line, bus) && fgets(pid, sizeof pid, bus);
        if (bus) {
            pclose(bus);
        }
        if (read) {
            address = line;
            address.erase(address.find_last_not_of('\n') + 1);
            busPid_ = std::stoi(pid);
            control_ = sdbus::createSessionBusConnectionWithAddress(address);
        }
    }
    ~PrivateBus() {
        stopBlueZ();
        control_.reset();
        if (busPid_ > 0) {
            kill(busPid_, SIGTERM);
        }
    }

    void startBlueZ() {
        bluezPid_ = fork();
        if (bluezPid_ == 0) {
            setenv("DBUS_SYSTEM_BUS_ADDRESS", address.c_str(), 1);
            const int quiet = open("/dev/null", O_WRONLY);
            dup2(quiet, STDOUT_FILENO);
            dup2(quiet, STDERR_FILENO);
            execl("/usr/bin/python3", "python3", "-m", "dbusmock", "--template", "bluez5",
                  static_cast<char*>(nullptr));
            _exit(127);
        }
        auto daemon =
            sdbus::createProxy(*control_, "org.freedesktop.DBus", "/org/freedesktop/DBus");
        ASSERT_TRUE(test::waitUntil([&] {
            bool owned = false;
            daemon->callMethod("NameHasOwner")
                .onInterface("org.freedesktop.DBus")
                .withArguments(std::string("org.bluez"))
                .storeResultsTo(owned);
            return owned;
        })) << "the mock BlueZ never came";
        mock_ = sdbus::createProxy(*control_, "org.bluez", "/");
    }
    void stopBlueZ() {
        mock_.reset();
        if (bluezPid_ > 0) {
            kill(bluezPid_, SIGTERM);
            waitpid(bluezPid_, nullptr, 0);
            bluezPid_ = -1;
        }
    }

    sdbus::IProxy& mock() { return *mock_; }

    // A device with the template's own calls: added, then paired and connected as asked.
    std::string addDevice(const std::string& device, bool paired, bool connected) {
        std::string path;
        mock_->callMethod("AddDevice")
            .onInterface(kMock)
            .withArguments("hci0", device, "Earbuds")
            .storeResultsTo(path);
        if (paired) {
            mock_->callMethod("PairDevice").onInterface(kMock).withArguments("hci0", device, 0u);
        }
        if (connected) {
            setConnected(device, true);
        }
        return path;
    }
    void setConnected(const std::string& device, bool connected) {
        mock_->callMethod(connected ? "ConnectDevice" : "DisconnectDevice")
            .onInterface(kMock)
            .withArguments("hci0", device);
    }

    std::string address;

  private:
    pid_t busPid_ = -1;
    pid_t bluezPid_ = -1;
    std::unique_ptr<sdbus::IConnection> control_;
    std::unique_ptr<sdbus::IProxy> mock_;
};

// The facility's log lines, whatever their level.
LinuxBluetoothFacility::LogCallback noting(test::Notes& notes) {
    return [&notes](LinuxBluetoothFacility::LogLevel, const std::string& line) { notes.add(line); };
}

void writeAccessory(const test::TempDirectory& dir, const std::string& address,
                    const std::string& text) {
    const auto tmp = dir / (address + ".tmp");
    std::ofstream(tmp) << text;
    std::filesystem::rename(tmp, dir / (address + ".json"));
}

const char* kGoodFile =
    R"({"TELPVersionInfo": ["a", "M4801", "c", "KEY"], "CaseInfo": {"CaseInfoVersion": "1"}})";

// Whether the facility lists the device of that address with accessory information.
bool hasInformation(const BluetoothFacility& facility, const std::string& address) {
    for (const auto& d : facility.pairedDevices()) {
        if (d.address == address) {
            return d.accessoryInformation.has_value();
        }
    }
    return false;
}

TEST(TheLinuxBluetoothFacility, FollowsBlueZAndTheAccessoryDirectory) {
    PrivateBus bus;
    ASSERT_FALSE(bus.address.empty()) << "no dbus-daemon";
    test::TempDirectory dir("qvaccessories");
    writeAccessory(dir, "00:00:00:00:00:01", kGoodFile);
    writeAccessory(dir, "00:00:00:00:00:02", kGoodFile);
    test::Notes log;
    LinuxBluetoothFacility facility(bus.address, dir.path().string(), noting(log));

    // No BlueZ yet: unavailable, and said so.
    ASSERT_TRUE(test::waitUntil([&] { return log.containing("org.bluez has no owner") == 1; }));
    EXPECT_FALSE(facility.available());
    EXPECT_TRUE(facility.pairedDevices().empty());

    bus.startBlueZ();
    ASSERT_TRUE(test::waitUntil([&] { return facility.available(); }));
    bus.mock().callMethod("AddAdapter").onInterface(kMock).withArguments("hci0", "bench");
    const std::string first = bus.addDevice("00:00:00:00:00:01", true, true);
    bus.addDevice("00:00:00:00:00:02", true, false);
    bus.addDevice("00:00:00:00:00:03", false, false);  // seen but not paired
    bus.addDevice("00:00:00:00:00:04", true, false);   // paired, no accessory file
    // Which devices are listed, in which order and with which files, the accessory report's
    // end-to-end test checks; the listed connection flags, which the daemon never reads, here.
    ASSERT_TRUE(test::waitUntil([&] { return facility.pairedDevices().size() == 3; }));
    const auto devices = facility.pairedDevices();
    EXPECT_TRUE(devices[0].connected);
    EXPECT_FALSE(devices[1].connected);

    // Connection changes arrive as signals.
    bus.setConnected("00:00:00:00:00:01", false);
    ASSERT_TRUE(test::waitUntil([&] { return !facility.isConnected(first); }));
    bus.setConnected("00:00:00:00:00:01", true);
    ASSERT_TRUE(test::waitUntil([&] { return facility.isConnected(first); }));

    // The directory is followed: a file that appears, one that goes bad, one that goes away.
    writeAccessory(dir, "00:00:00:00:00:04", kGoodFile);
    ASSERT_TRUE(test::waitUntil([&] { return hasInformation(facility, "00:00:00:00:00:04"); }))
        << testing::PrintToString(log.lines());
    writeAccessory(dir, "00:00:00:00:00:02", "{\"TELPVersionInfo\": 5, \"CaseInfo\": {}}");
    ASSERT_TRUE(test::waitUntil([&] { return !hasInformation(facility, "00:00:00:00:00:02"); }));
    EXPECT_EQ(
        log.containing("00:00:00:00:00:02.json refused: its \"TELPVersionInfo\" is not a list"),
        1u);
    std::filesystem::remove(dir / "00:00:00:00:00:04.json");
    ASSERT_TRUE(test::waitUntil([&] { return !hasInformation(facility, "00:00:00:00:00:04"); }));

    // A device removed from BlueZ leaves the list.
    bus.mock()
        .callMethod("RemoveDevice")
        .onInterface("org.bluez.Adapter1")
        .withArguments(sdbus::ObjectPath(first));
    ASSERT_TRUE(test::waitUntil([&] { return facility.pairedDevices().size() == 2; }));
    EXPECT_FALSE(facility.isConnected(first));

    // BlueZ goes away and comes back: unavailable, then read afresh.
    const auto syncs = facility.TEST_syncCount();
    bus.stopBlueZ();
    ASSERT_TRUE(test::waitUntil([&] { return !facility.available(); }));
    EXPECT_TRUE(facility.pairedDevices().empty());
    bus.startBlueZ();
    ASSERT_TRUE(test::waitUntil([&] { return facility.TEST_syncCount() > syncs; }));
    EXPECT_TRUE(facility.available());
    EXPECT_TRUE(facility.pairedDevices().empty()) << "the new BlueZ has no devices yet";
}

}  // namespace
}  // namespace qv
