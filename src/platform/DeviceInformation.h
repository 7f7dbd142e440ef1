// What the daemon knows about the device it runs on.
//
// Thread safety: implementations are safe to call from any thread.
#pragma once

#include <filesystem>
#include <optional>
#include <string_view>

namespace qv {

class DeviceInformation {
  public:
    virtual ~DeviceInformation() = default;

    // The boolean answer under a key such as "InternalBuild", or nothing when the device does not
    // answer (no device description, or no such key).
    virtual std::optional<bool> boolAnswer(std::string_view key) const = 0;
    // Whether the device declares a capability; false when it is not declared.
    virtual bool hasCapability(std::string_view capability) const = 0;
    // Where the device keeps diagnostic logs (session summary files, trace results).
    virtual std::filesystem::path diagnosticLogsDirectory() const = 0;
};

}  // namespace qv
