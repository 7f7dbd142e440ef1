// The Bluetooth facility: which wireless accessories are paired with this device, what each says
// about itself (its accessory information) and whether it is connected now. The platform's one
// instance is the shared instance every user of the facility asks.
//
// Answers come from state the implementation keeps current on a thread of its own, so every
// query is a look-up in memory and returns at once; none waits on the radio, the bus or a disk.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "values/Value.h"

namespace qv {

// Keys of an accessory information dictionary.
namespace accessory {
// List of the accessory's version and identity elements, read by position.
inline constexpr std::string_view kTELPVersionInfo = "TELPVersionInfo";
// Dictionary describing the accessory's charging case.
inline constexpr std::string_view kCaseInfo = "CaseInfo";
// Key of kCaseInfo: the case's firmware version.
inline constexpr std::string_view kCaseInfoVersion = "CaseInfoVersion";
}  // namespace accessory

// One paired device as the facility saw it when asked.
struct BluetoothPairedDevice {
    // Names the device to isConnected(); stable while the device stays paired.
    std::string identifier;
    // The Bluetooth address, upper case with colons ("AA:BB:CC:DD:EE:FF").
    std::string address;
    // The device's accessory information, or nothing when it has none.
    std::optional<Dictionary> accessoryInformation;
    // Whether the device was connected when the list was made.
    bool connected = false;
};

class BluetoothFacility {
  public:
    virtual ~BluetoothFacility() = default;

    // Whether the facility is up and knows the paired devices; while it is not, pairedDevices()
    // answers an empty list.
    virtual bool available() const = 0;
    // The paired devices, in the facility's own stable order.
    virtual std::vector<BluetoothPairedDevice> pairedDevices() const = 0;
    // Whether the device of that identifier is connected now; false for a device the facility
    // no longer knows.
    virtual bool isConnected(std::string_view identifier) const = 0;
};

}  // namespace qv
