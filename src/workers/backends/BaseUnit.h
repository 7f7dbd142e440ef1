// Reads the Bluetooth facility and turns each qualifying paired earbud device into a dictionary
// of registration parameters, one side (Left, Right, Case) at a time, for the weekly accessory
// registration report.
//
// A device qualifies when its accessory information's "TELPVersionInfo" list has exactly 15
// elements and element 1 is the model "M4801". Elements are read by position:
//   1 model number        3 device key (and the Case identifier)   8, 9 Left/Right serials
//   10 firmware version   11, 12 Left/Right identifiers            13, 14 Left/Right pairing days
// An element that a side needs and that is missing or of the wrong kind throws BTAccessError.
//
// The registration dictionary belongs to BTAccess; this class fills its "splunk" list. Dates of
// first pairing leave privacy-reduced by quantizeEpochToDayofWeek(). The last time each device
// was seen connected is kept in the user-defaults suite of the registration report.
//
// Thread safety: none; one gathering at a time (the registration worker holds its lock).
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

#include "platform/BluetoothFacility.h"
#include "platform/Platform.h"
#include "values/Value.h"

namespace qv {

// What a gathering raises when a device's accessory information lacks what it needs.
class BTAccessError : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

class BaseUnit {
  public:
    // Sides of a device, and the names that suffix their keys.
    enum Side : int { kLeft = 0, kRight = 1, kCase = 2 };

    static constexpr std::string_view kModel = "M4801";
    static constexpr std::size_t kVersionInfoCount = 15;
    // The facility may still be starting: it is asked again this often, this far apart.
    static constexpr int kAvailabilityPolls = 10;
    static constexpr std::chrono::milliseconds kAvailabilityPollPause{10};

    static constexpr std::string_view kSuite = "com.korvane.qvsound.qvreporting.audioreg";
    static constexpr std::string_view kLastConnectedKey = "BTDevicesLastConnectedEpoch";
    static constexpr std::string_view kSplunkKey = "splunk";
    static constexpr std::string_view kAudioModelNumber = "AudioModelNumber";
    static constexpr std::string_view kAudioUUID = "AudioUUID";
    static constexpr std::string_view kAudioFWVersion = "AudioFWVersion";
    static constexpr std::string_view kAudioFirstPairingDate = "AudioFirstPairingDate";
    static constexpr std::string_view kLastConnectedEpoch = "lastConnectedEpoch";

    using Sleeper = std::function<void(std::chrono::milliseconds)>;

    // registrationInfoParams is BTAccess's dictionary; it must outlive this object.
    BaseUnit(const Platform& platform, Dictionary& registrationInfoParams);

    BaseUnit(const BaseUnit&) = delete;
    BaseUnit& operator=(const BaseUnit&) = delete;

    // Refreshes the list of qualifying devices; keeps the old list when the facility does not
    // become available.
    void enumerateBluetoothDevices();
    std::uint16_t getDeviceCount() const { return static_cast<std::uint16_t>(devices_.size()); }
    // Adds one side of device accessoryIndex to the "splunk" list (a new entry when the index is
    // one past the end, else merged into the entry there).
    void loadParams(int side, std::size_t accessoryIndex);

    void initializeProductType(int side, std::size_t deviceIndex);
    void initializeUUID(int side, std::size_t deviceIndex);
    void initializeSerialNumber(int side, std::size_t deviceIndex);
    void initializeProductVersion(int side, std::size_t deviceIndex);
    void initializePairingDate(int side, std::size_t deviceIndex);
    // Records "lastConnectedEpoch": now when the device is connected (remembered under its
    // element-3 key), else the time remembered, else 0.
    void checkForActiveConnection(std::size_t index);

    // Moves a date forward by d days when it falls on day d = 3, 4 or 5 of its epoch week (the
    // epoch began on a Thursday), and back by d + 1 days otherwise; the arithmetic is done on
    // the unsigned 64-bit form of epoch.
    static std::int64_t quantizeEpochToDayofWeek(std::int64_t epoch);

    Dictionary& RegistrationInfoParams() { return registrationInfoParams_; }
    const std::vector<BluetoothPairedDevice>& devices() const { return devices_; }
    static std::string_view sideName(int side);

    // For tests: replaces the pause between availability polls (the default sleeps).
    static void TEST_setSleeper(Sleeper sleeper);

  private:
    const BluetoothPairedDevice& device(std::size_t index) const;
    const Array& versionInfo(std::size_t index) const;
    // Element i of device index's version list, checked to be a string or a number.
    const Value& identityElement(std::size_t index, std::size_t element) const;

    const Platform& platform_;
    Dictionary& registrationInfoParams_;
    // Entries of one side, gathered before they are merged into the device's entry.
    Dictionary scratch_;
    std::vector<BluetoothPairedDevice> devices_;
};

}  // namespace qv
