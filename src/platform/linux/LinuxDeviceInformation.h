// Device information on Linux: a JSON file such as /etc/qvreportd/device.json holding
// {"InternalBuild": bool, "capabilities": {name: bool}}. A missing or unreadable file describes a
// customer build without capabilities. The file is read once, at construction.
#pragma once

#include <map>
#include <optional>
#include <string>

#include "platform/DeviceInformation.h"

namespace qv {

class LinuxDeviceInformation final : public DeviceInformation {
  public:
    // internalBuildOverride, when set, answers "InternalBuild" whatever the file says.
    // Diagnostic logs go to logsDirectory (the state directory's logs/ in the daemon).
    LinuxDeviceInformation(const std::string& path, std::filesystem::path logsDirectory,
                           std::optional<bool> internalBuildOverride = std::nullopt);

    std::optional<bool> boolAnswer(std::string_view key) const override;
    bool hasCapability(std::string_view capability) const override;
    std::filesystem::path diagnosticLogsDirectory() const override { return logsDirectory_; }

    // Why the file could not be used, empty when it was read (or simply absent).
    const std::string& loadError() const { return loadError_; }

  private:
    std::optional<bool> internalBuild_;
    std::map<std::string, bool, std::less<>> capabilities_;
    std::string loadError_;
    std::filesystem::path logsDirectory_;
};

}  // namespace qv
