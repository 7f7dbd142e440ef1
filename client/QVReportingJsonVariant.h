// JSON to D-Bus variants and back, for qvreportctl: payloads and configurations typed on the
// command line or read from session scripts, and replies printed for people and scripts.
//
// JSON to D-Bus: integers become x (int64), or t (uint64) beyond the int64 range; fractions d;
// booleans b; strings s; arrays av; objects a{sv}. The object {"$now": OFFSET} (that one key, a
// number) stands for the current time plus OFFSET seconds, as a double, so that scripts can
// carry timestamps the daemon accepts as recent. null has no D-Bus form and is refused.
//
// D-Bus to JSON: every integer type a number, d a number, b a boolean, s o g strings, variants
// unwrapped, a{s?} objects, dictionaries with other keys arrays of [key, value] pairs, other
// arrays (ay included) and structs arrays, a unix fd the string "<fd>".
//
// Thread safety: pure functions.
#pragma once

#include <cstddef>
#include <map>
#include <optional>
#include <stdexcept>
#include <string>

#include <sdbus-c++/Types.h>
#include <nlohmann/json.hpp>

namespace qv::client {

using VariantMap = std::map<std::string, sdbus::Variant>;

// A JSON value that has no D-Bus form; what() names where it is ("payload.list[2]").
class QVReportingJsonConversionError : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

struct QVReportingJsonConversionOptions {
    // Seconds since 1970 that {"$now": OFFSET} is counted from; without it such an object is
    // refused.
    std::optional<double> now;
    // Deeper JSON is refused rather than recursed into (the daemon takes far less anyway).
    std::size_t maxDepth = 64;
};

// Throw QVReportingJsonConversionError; path names the value in messages.
sdbus::Variant QVReportingJsonToVariant(const nlohmann::ordered_json& json,
                                        const QVReportingJsonConversionOptions& options = {},
                                        const std::string& path = "value");
// json must be an object.
VariantMap QVReportingJsonToVariantMap(const nlohmann::ordered_json& json,
                                       const QVReportingJsonConversionOptions& options = {},
                                       const std::string& path = "value");

nlohmann::ordered_json QVReportingVariantToJson(const sdbus::Variant& variant);
nlohmann::ordered_json QVReportingVariantMapToJson(const VariantMap& map);

}  // namespace qv::client
