#include "platform/linux/bluetooth/AccessoryInformationFile.h"

#include <algorithm>

#include <fmt/format.h>
#include <nlohmann/json.hpp>

#include "platform/BluetoothFacility.h"
#include "platform/SafeFileName.h"
#include "platform/linux/sinks/RegularFile.h"
#include "values/ValueJson.h"

namespace qv {

namespace {

constexpr std::size_t kAddressLength = 17;  // "AA:BB:CC:DD:EE:FF"

AccessoryFileResult refused(std::string reason) {
    return {AccessoryFileResult::Status::Refused, {}, std::move(reason)};
}

}  // namespace

std::optional<std::string> QVReportingCanonicalBluetoothAddress(std::string_view text) {
    if (text.size() != kAddressLength) {
        return std::nullopt;
    }
    std::string canonical(text);
    for (std::size_t i = 0; i < canonical.size(); ++i) {
        char& c = canonical[i];
        if (i % 3 == 2) {
            if (c != ':') {
                return std::nullopt;
            }
        } else if (c >= 'a' && c <= 'f') {
            c = static_cast<char>(c - 'a' + 'A');
        } else if (!((c >= '0' && c <= '9') || (c >= 'A' && c <= 'F'))) {
            return std::nullopt;
        }
    }
    return canonical;
}

std::string QVReportingAccessoryFilePath(const std::string& directory,
                                         const std::string& canonicalAddress) {
    // The address is checked already; the safe name keeps it inside the directory regardless.
    return directory + "/" + QVReportingSafeFileComponent(canonicalAddress + ".json");
}

AccessoryFileResult QVReportingReadAccessoryFile(const std::string& directory,
                                                 const std::string& canonicalAddress) {
    const std::string path = QVReportingAccessoryFilePath(directory, canonicalAddress);
    // No symbolic link may lead out of the directory, and a pipe or device must not block us.
    RegularFileRead file = QVReportingReadRegularFile(path, kMaxAccessoryFileBytes);
    if (file.status == RegularFileRead::Status::Missing) {
        return {};
    }
    if (file.status == RegularFileRead::Status::Refused) {
        return refused(std::move(file.reason));
    }
    const std::string& text = file.text;

    if (text.find('\0') != std::string::npos) {
        return refused("it is not JSON");  // the parser would read up to the NUL only
    }
    std::size_t deepest = 0;
    const auto json = nlohmann::ordered_json::parse(
        text,
        [&deepest](int depth, nlohmann::ordered_json::parse_event_t, nlohmann::ordered_json&) {
            deepest = std::max(deepest, static_cast<std::size_t>(depth));
            return true;
        },
        /*allow_exceptions=*/false);
    if (json.is_discarded()) {
        return refused("it is not JSON");
    }
    // The callback's depth counts the containers open around a value.
    if (deepest > kMaxAccessoryFileDepth) {
        return refused(fmt::format("it is nested deeper than {} levels", kMaxAccessoryFileDepth));
    }
    if (!json.is_object()) {
        return refused("it is not a JSON object");
    }
    const auto versions = json.find(accessory::kTELPVersionInfo);
    if (versions == json.end()) {
        return refused(fmt::format("it has no \"{}\"", accessory::kTELPVersionInfo));
    }
    if (!versions->is_array()) {
        return refused(fmt::format("its \"{}\" is not a list", accessory::kTELPVersionInfo));
    }
    const auto caseInfo = json.find(accessory::kCaseInfo);
    if (caseInfo == json.end()) {
        return refused(fmt::format("it has no \"{}\"", accessory::kCaseInfo));
    }
    if (!caseInfo->is_object()) {
        return refused(fmt::format("its \"{}\" is not an object", accessory::kCaseInfo));
    }
    AccessoryFileResult r;
    r.status = AccessoryFileResult::Status::Loaded;
    r.information = QVReportingDictionaryFromJson(json);
    return r;
}

}  // namespace qv
