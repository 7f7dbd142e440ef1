// A Bluetooth facility in memory: the test lists the paired devices and flips their connection
// state. It becomes available after a number of "available" questions, so a test can play a
// facility that starts late or never.
#pragma once

#include <limits>
#include <mutex>
#include <string>
#include <vector>

#include "platform/BluetoothFacility.h"

namespace qv::test {

class FakeBluetoothFacility : public BluetoothFacility {
  public:
    bool available() const override {
        std::lock_guard lock(mutex_);
        ++availabilityQuestions;
        return availabilityQuestions > unavailableAnswers;
    }
    std::vector<BluetoothPairedDevice> pairedDevices() const override {
        std::lock_guard lock(mutex_);
        return devices;
    }
    bool isConnected(std::string_view identifier) const override {
        std::lock_guard lock(mutex_);
        for (const auto& d : devices) {
            if (d.identifier == identifier) {
                return d.connected;
            }
        }
        return false;
    }

    // Adds a paired device; the identifier is made from the address.
    void addDevice(const std::string& address, std::optional<Dictionary> information,
                   bool connected) {
        std::lock_guard lock(mutex_);
        devices.push_back({"/dev/" + address, address, std::move(information), connected});
    }
    void setConnected(const std::string& address, bool connected) {
        std::lock_guard lock(mutex_);
        for (auto& d : devices) {
            if (d.address == address) {
                d.connected = connected;
            }
        }
    }
    void neverAvailable() {
        std::lock_guard lock(mutex_);
        unavailableAnswers = std::numeric_limits<int>::max();
    }

    // Settings and record (under the fake's lock when the code under test may run).
    std::vector<BluetoothPairedDevice> devices;
    // How many "available" questions are answered false before the first true.
    int unavailableAnswers = 0;
    mutable int availabilityQuestions = 0;

  private:
    mutable std::mutex mutex_;
};

}  // namespace qv::test
