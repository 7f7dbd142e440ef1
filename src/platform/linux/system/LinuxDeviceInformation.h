// Device information on Linux: a JSON file such as /etc/qvreportd/device.json holding
// {"InternalBuild": bool, "capabilities": {name: bool}}. A missing or unreadable file describes a
// customer build without capabilities. The file is read once, at construction; it must be a
// regular file of at most kMaxDeviceFileBytes (a pipe, a device, a directory or a link in its
// place is refused, and the device is then a customer build too).
#pragma once

#include <cstddef>
#include <map>
#include <optional>
#include <string>

#include "platform/DeviceInformation.h"

namespace qv {

class LinuxDeviceInformation final : public DeviceInformation {
  public:
    // A real device file is a few hundred bytes.
    static constexpr std::size_t kMaxDeviceFileBytes = 1024 * 1024;

    // internalBuildOverride, when set, answers "InternalBuild" whatever the file says.
    // Diagnostic logs go to logsDirectory (the state directory's logs/ in the daemon).
    LinuxDeviceInformation(const std::string& path, std::filesystem::path logsDirectory,
                           std::optional<bool> internalBuildOverride = std::nullopt);

    std::optional<bool> boolAnswer(std::string_view key) const override;
    bool hasCapability(std::string_view capability) const override;
    std::filesystem::path diagnosticLogsDirectory() const override { return logsDirectory_; }

    // Why the file could not be used, empty when it was read (or simply absent).
    const std::string& loadError() const { return loadError_; }
    // Whether the file was refused for what it is (not a regular file, a link, too large).
    bool fileRefused() const { return fileRefused_; }

  private:
    std::optional<bool> internalBuild_;
    std::map<std::string, bool, std::less<>> capabilities_;
    std::string loadError_;
    bool fileRefused_ = false;
    std::filesystem::path logsDirectory_;
};

}  // namespace qv
