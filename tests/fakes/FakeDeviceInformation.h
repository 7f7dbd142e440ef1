// Device information set by the test.
#pragma once

#include <map>
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
        auto it = capabilities.find(std::string(capability));
        return it != capabilities.end() && it->second;
    }

    std::filesystem::path diagnosticLogsDirectory() const override { return logsDirectory; }

    std::optional<bool> internalBuild;
    std::filesystem::path logsDirectory = "/nonexistent/logs";
    std::map<std::string, bool> capabilities;
    mutable int questions = 0;  // how often the device was asked
};

}  // namespace qv::test
