// The Bluetooth facility on Linux: BlueZ read over D-Bus, accessory information read from files.
//
// - available: the name "org.bluez" has an owner on the bus, and its objects have been read;
// - paired devices: the objects with the interface "org.bluez.Device1" whose "Paired" is true,
//   in object-path order (the identifier is the object path);
// - connected: the device's "Connected" property;
// - accessory information: ACCESSORY_DIR/ADDRESS.json (AccessoryInformationFile.h), ADDRESS
//   being the device's "Address" property in canonical form. A device whose address is not a
//   Bluetooth address, or that has no such file, has no accessory information.
//
// Queries never touch the bus or a disk: a thread of the facility's own keeps a copy of the state
// current and queries read that copy under a lock. The thread connects to its bus (the system bus
// or an address), retrying with a growing pause while the bus cannot be reached; follows the owner
// of "org.bluez" (NameOwnerChanged) and reads all its objects when it appears (GetManagedObjects,
// with a time-out); then follows InterfacesAdded, InterfacesRemoved and PropertiesChanged of
// Device1, believing only signals sent by the owner it knows. Accessory files are read when a
// device first shows its address and again whenever the directory says the file changed
// (inotify); the directory is watched once it exists.
//
// Whatever BlueZ or the directory hold, nothing is read outside the accessory directory, the
// number of devices kept is bounded, and every refusal is logged once per change.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/BluetoothFacility.h"

namespace sdbus {
class Variant;
}  // namespace sdbus

namespace qv {

class LinuxBluetoothFacility final : public BluetoothFacility {
  public:
    static constexpr std::string_view kDefaultAccessoryDirectory = "/etc/qvreportd/accessories";
    // A host pairs with a handful of devices; a stack that claims more is not believed.
    static constexpr std::size_t kMaxDevices = 1024;
    // Longest wait for BlueZ to list its objects (on the facility's thread).
    static constexpr std::chrono::milliseconds kCallTimeout{3000};
    // Pauses between attempts to reach the bus, doubling from the first to the last.
    static constexpr std::chrono::milliseconds kFirstRetry{500};
    static constexpr std::chrono::milliseconds kLongestRetry{30000};
    // How often a missing accessory directory is looked for again.
    static constexpr std::chrono::milliseconds kDirectoryRetry{5000};

    // What the facility has to say, for the daemon's log: a level and a line.
    enum class LogLevel { Info, Default, Error };
    using LogCallback = std::function<void(LogLevel level, const std::string& line)>;

    // bus: "system" or a D-Bus address. Starts the facility's thread, which connects at once.
    // log hears every line, on the facility's thread; fileRefused hears of each accessory file
    // newly refused (it is logged too).
    LinuxBluetoothFacility(std::string bus, std::string accessoryDirectory, LogCallback log,
                           std::function<void()> fileRefused = {});
    // Ends the thread (within kCallTimeout when it is waiting on BlueZ).
    ~LinuxBluetoothFacility() override;

    LinuxBluetoothFacility(const LinuxBluetoothFacility&) = delete;
    LinuxBluetoothFacility& operator=(const LinuxBluetoothFacility&) = delete;

    bool available() const override;
    std::vector<BluetoothPairedDevice> pairedDevices() const override;
    bool isConnected(std::string_view identifier) const override;

    // For tests: how many times the objects of "org.bluez" were read, so a test can wait for the
    // facility to have caught up with a change it made.
    std::uint64_t TEST_syncCount() const { return syncCount_.load(); }

  private:
    struct Device {
        bool paired = false;
        bool connected = false;
        // Canonical address, empty while none (or none valid) is known.
        std::string address;
    };
    struct Accessory {
        std::optional<Dictionary> information;
        // Outcome last logged, so a file's state is reported once per change.
        std::string lastOutcome;
    };
    using Properties = std::map<std::string, sdbus::Variant>;
    class Session;

    void note(LogLevel level, const std::string& line) const {
        if (log_) {
            log_(level, line);
        }
    }
    // A boolean property, or nothing (logged) when the stack sent another type.
    std::optional<bool> boolProperty(const std::string& path, const char* name,
                                     const sdbus::Variant& value) const;

    // The facility's thread: connects, serves, reconnects until stopped.
    void run();
    // Waits on the stop descriptor for at most timeout.
    void pause(std::chrono::milliseconds timeout);

    // On the facility's thread. The ...Locked ones expect mutex_ held.
    void clearLocked();
    // Applies a Device1 property set; fresh: the set describes a device that is new.
    void applyDevicePropertiesLocked(const std::string& path, const Properties& properties,
                                     bool fresh);
    // Reads the accessory files of the addresses marked for reading (outside the lock), then
    // stores what they hold and forgets addresses no device has any longer.
    void readMarkedAccessories();
    void markAllAccessoriesLocked();

    // Directory watch (facility's thread).
    void watchDirectory();
    void drainDirectoryEvents();

    const std::string bus_;
    const std::string accessoryDirectory_;
    const LogCallback log_;
    const std::function<void()> fileRefused_;
    int stopFd_ = -1;
    int inotifyFd_ = -1;
    int watch_ = -1;
    std::chrono::steady_clock::time_point nextWatchAttempt_{};

    mutable std::mutex mutex_;
    bool available_ = false;                        // guarded by mutex_
    std::map<std::string, Device> devices_;         // guarded by mutex_; by object path
    std::map<std::string, Accessory> accessories_;  // guarded by mutex_; by address
    bool tooManyLogged_ = false;                    // guarded by mutex_
    // Addresses whose files are to be read (facility's thread only).
    std::vector<std::string> marked_;
    bool directoryMissingLogged_ = false;  // facility's thread only

    std::atomic<bool> stopping_{false};
    std::atomic<std::uint64_t> syncCount_{0};
    // Last: its thread uses everything above.
    std::thread thread_;
};

}  // namespace qv
