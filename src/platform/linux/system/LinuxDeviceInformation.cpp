#include "platform/linux/system/LinuxDeviceInformation.h"

#include <nlohmann/json.hpp>

#include <string>

#include "platform/linux/sinks/RegularFile.h"

namespace qv {

LinuxDeviceInformation::LinuxDeviceInformation(const std::string& path,
                                               std::filesystem::path logsDirectory,
                                               std::optional<bool> internalBuildOverride)
    : logsDirectory_(std::move(logsDirectory)) {
    const RegularFileRead file = QVReportingReadRegularFile(path, kMaxDeviceFileBytes);
    if (file.status == RegularFileRead::Status::Read) {
        const std::string& text = file.text;
        // The parser takes a NUL byte for the end of the text; JSON holds none, so such a file
        // is not one (rather than the part before the NUL).
        const auto doc = text.find('\0') != std::string::npos
                             ? nlohmann::json()
                             : nlohmann::json::parse(text, nullptr, /*allow_exceptions=*/false);
        if (!doc.is_object()) {
            loadError_ = path + ": not a JSON object";
        } else {
            if (auto it = doc.find("InternalBuild"); it != doc.end() && it->is_boolean()) {
                internalBuild_ = it->get<bool>();
            }
            if (auto caps = doc.find("capabilities"); caps != doc.end() && caps->is_object()) {
                for (const auto& [name, value] : caps->items()) {
                    if (value.is_boolean()) {
                        capabilities_[name] = value.get<bool>();
                    }
                }
            }
        }
    } else if (file.status == RegularFileRead::Status::Refused) {
        loadError_ = path + ": " + file.reason;
        fileRefused_ = true;
    }
    if (internalBuildOverride) {
        internalBuild_ = internalBuildOverride;
    }
}

std::optional<bool> LinuxDeviceInformation::boolAnswer(std::string_view key) const {
    if (key == "InternalBuild") {
        return internalBuild_;
    }
    return std::nullopt;
}

bool LinuxDeviceInformation::hasCapability(std::string_view capability) const {
    auto it = capabilities_.find(capability);
    return it != capabilities_.end() && it->second;
}

}  // namespace qv
