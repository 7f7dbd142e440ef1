// Accessory information files: what a paired accessory says about itself, one JSON file per
// accessory in the accessory directory, named after its Bluetooth address:
//   ACCESSORY_DIR/AA:BB:CC:DD:EE:FF.json
//   {"TELPVersionInfo": [ ...15 elements... ], "CaseInfo": {"CaseInfoVersion": "..."}}
//
// The address comes from the Bluetooth stack, which this daemon does not control, so only a
// well-formed address ever names a file, and the file must be a plain file of the directory (no
// symbolic link, no device or pipe that could block the reader) of bounded size and depth.
//
// Thread safety: pure functions over the file system.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "values/Value.h"

namespace qv {

// Largest accessory file read: a real one is well under a kilobyte.
inline constexpr std::size_t kMaxAccessoryFileBytes = 64 * 1024;
// Deepest JSON nesting accepted: the format needs three levels.
inline constexpr std::size_t kMaxAccessoryFileDepth = 8;

// The address in canonical form (six two-digit hex groups separated by ":", upper case), or
// nothing when text is not such an address in any letter case.
std::optional<std::string> QVReportingCanonicalBluetoothAddress(std::string_view text);

// The file of an accessory, for an address already in canonical form.
std::string QVReportingAccessoryFilePath(const std::string& directory,
                                         const std::string& canonicalAddress);

struct AccessoryFileResult {
    enum class Status { Loaded, Missing, Refused };
    Status status = Status::Missing;
    // The accessory information when Loaded.
    Dictionary information;
    // Why the file was refused (or could not be read) when Refused.
    std::string reason;
};

// Reads the accessory file of canonicalAddress in directory. Missing: no such file. Refused: the
// file exists but is not a regular file, cannot be read, is larger than kMaxAccessoryFileBytes,
// is not JSON, is nested deeper than kMaxAccessoryFileDepth, is not an object, or lacks
// "TELPVersionInfo" as a list or "CaseInfo" as an object.
AccessoryFileResult QVReportingReadAccessoryFile(const std::string& directory,
                                                 const std::string& canonicalAddress);

}  // namespace qv
