// Device information set by the test.
#pragma once

#include <optional>
#include <string>

#include "platform/DeviceInformation.h"

namespace qv::test {

class FakeDeviceInformation : public DeviceInformation {
  public:
    std::optional<bool> boolAnswer(std::string_view key) const override {
        ++questions;
        if (key == "InternalBuild") {
            return internalBuild;
        }
        return std::nullopt;
    }
    bool hasCapability(std::string_view capability) const override {
        return haptics && capability == "haptics";
    }

    std::filesystem::path diagnosticLogsDirectory() const override { return logsDirectory; }

    std::optional<bool> internalBuild;
    std::filesystem::path logsDirectory = "/nonexistent/logs";
    bool haptics = false;       // the one capability asked for
    mutable int questions = 0;  // how often the device was asked
};

}  // namespace qv::test
