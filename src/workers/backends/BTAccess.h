// The one-call front of the accessory information: gatherData() rebuilds the registration
// dictionary ({"splunk": [one entry per qualifying device]}) from the Bluetooth facility.
//
// Thread safety: none; one gathering at a time (the registration worker holds its lock).
#pragma once

#include "platform/Platform.h"
#include "values/Value.h"
#include "workers/backends/BaseUnit.h"

namespace qv {

class BTAccess {
  public:
    explicit BTAccess(const Platform& platform);

    BTAccess(const BTAccess&) = delete;
    BTAccess& operator=(const BTAccess&) = delete;

    // Empties the registration dictionary, enumerates the devices and loads the Left and Right
    // sides of each (the Case side only for a device with a case). Returns the dictionary.
    // Throws BTAccessError when a device lacks an element read.
    const Dictionary& gatherData();
    // No device reports a case of its own yet, so the Case side is never loaded.
    bool isDeviceWithCase() const { return false; }

    BaseUnit& baseUnit() { return baseUnit_; }

  private:
    Dictionary registrationInfo_;
    // Fills registrationInfo_.
    BaseUnit baseUnit_;
};

}  // namespace qv
