#include "session/DataSerialize.h"

#include <plist/plist.h>

#include <cmath>
#include <cstdint>
#include <ctime>
#include <limits>
#include <memory>

#include <fmt/format.h>

#include "values/Base64.h"
#include "values/Utf8.h"

namespace qv {

namespace {

struct PlistFree {
    void operator()(void* node) const { plist_free(static_cast<plist_t>(node)); }
};
using PlistPtr = std::unique_ptr<void, PlistFree>;

// Seconds from 1970-01-01 to 2001-01-01, the epoch of property-list dates.
constexpr double kPlistEpochSince1970 = 978307200.0;

// The property-list node of one element written in XML, for the values the node constructors
// cannot make: the library reads them into a wider form than it lets a caller set directly.
PlistPtr parseElement(const std::string& element) {
    const std::string xml = "<plist version=\"1.0\">" + element + "</plist>";
    plist_t node = nullptr;
    plist_from_xml(xml.data(), static_cast<std::uint32_t>(xml.size()), &node);
    return PlistPtr(node);
}

PlistPtr makeInteger(std::int64_t i) {
    // The library's one integer node is written as a signed 64-bit number, so a negative value
    // stored in two's complement comes out as itself.
    return PlistPtr(plist_new_uint(static_cast<std::uint64_t>(i)));
}

PlistPtr makeUnsigned(std::uint64_t u) {
    if (u <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
        return PlistPtr(plist_new_uint(u));
    }
    // Above 2^63 - 1 the node constructor's value would be written as a negative number; a
    // parsed integer remembers that it is unsigned.
    return parseElement(fmt::format("<integer>{}</integer>", u));
}

PlistPtr makeDate(double secondsSince1970) {
    if (!std::isfinite(secondsSince1970)) {
        return nullptr;
    }
    // XML dates carry whole seconds, and the library's writer would truncate a fraction toward
    // zero (moving times before 2001 a second late), so the date is floored here.
    const double since2001 = std::floor(secondsSince1970 - kPlistEpochSince1970);
    if (since2001 >= std::numeric_limits<std::int32_t>::min() &&
        since2001 <= std::numeric_limits<std::int32_t>::max()) {
        return PlistPtr(plist_new_date(static_cast<std::int32_t>(since2001), 0));
    }
    // Beyond the constructor's 32-bit range of seconds (1933 to 2069), write the date in XML
    // and let the library read it; XML dates have four-digit years and whole seconds.
    const double floorSince1970 = std::floor(secondsSince1970);
    if (std::fabs(floorSince1970) > 1e12) {  // far beyond year 9999 either way
        return nullptr;
    }
    const std::time_t t = static_cast<std::time_t>(floorSince1970);
    std::tm tm{};
    if (gmtime_r(&t, &tm) == nullptr || tm.tm_year + 1900 < 1000 || tm.tm_year + 1900 > 9999) {
        return nullptr;
    }
    return parseElement(fmt::format("<date>{:04}-{:02}-{:02}T{:02}:{:02}:{:02}Z</date>",
                                    tm.tm_year + 1900, tm.tm_mon + 1, tm.tm_mday, tm.tm_hour,
                                    tm.tm_min, tm.tm_sec));
}

bool hasNul(const std::string& s) {
    return s.find('\0') != std::string::npos;
}

// The property-list tree of value, or null when some part of it is not a property list.
// Recursive: payloads reach here with their nesting already bounded by the input limits.
PlistPtr toPlist(const Value& value) {
    using K = Value::Kind;
    switch (value.kind()) {
        case K::Null:
            return nullptr;
        case K::Bool:
            return PlistPtr(plist_new_bool(value.boolValue() ? 1 : 0));
        case K::Int:
            return makeInteger(*value.asInt64());
        case K::UInt:
            return makeUnsigned(*value.asUInt64());
        case K::Double:
            return PlistPtr(plist_new_real(*value.asDouble()));
        case K::String: {
            const std::string& s = *value.asString();
            return hasNul(s) ? nullptr : PlistPtr(plist_new_string(s.c_str()));
        }
        case K::Bytes: {
            // An empty vector may have no buffer at all; the library copies from the pointer.
            static const char kNoBytes = 0;
            const Bytes& b = *value.asBytes();
            return PlistPtr(plist_new_data(
                b.empty() ? &kNoBytes : reinterpret_cast<const char*>(b.data()), b.size()));
        }
        case K::Date:
            return makeDate(value.asDate()->secondsSince1970);
        case K::Array: {
            PlistPtr array(plist_new_array());
            for (const Value& item : *value.asArray()) {
                PlistPtr node = toPlist(item);
                if (!node) {
                    return nullptr;
                }
                plist_array_append_item(array.get(), node.release());
            }
            return array;
        }
        case K::Dictionary: {
            PlistPtr dict(plist_new_dict());
            for (const auto& [key, item] : *value.asDictionary()) {
                if (hasNul(key)) {
                    return nullptr;
                }
                PlistPtr node = toPlist(item);
                if (!node) {
                    return nullptr;
                }
                plist_dict_set_item(dict.get(), key.c_str(), node.release());
            }
            return dict;
        }
    }
    return nullptr;
}

}  // namespace

std::optional<Bytes> DataSerialize::getPlistBlob(const Value& value) {
    const PlistPtr root = toPlist(value);
    if (!root) {
        return std::nullopt;
    }
    char* xml = nullptr;
    std::uint32_t length = 0;
    plist_to_xml(root.get(), &xml, &length);
    if (xml == nullptr) {
        return std::nullopt;
    }
    Bytes blob(reinterpret_cast<const std::uint8_t*>(xml),
               reinterpret_cast<const std::uint8_t*>(xml) + length);
    plist_to_xml_free(xml);
    return blob;
}

std::optional<std::string> DataSerialize::getXMLInfo(const Value& value) {
    const auto blob = getPlistBlob(value);
    if (!blob) {
        return std::nullopt;
    }
    for (const std::uint8_t b : *blob) {
        if (b >= 0x80) {
            return std::nullopt;
        }
    }
    return std::string(blob->begin(), blob->end());
}

std::optional<std::string> DataSerialize::getDataXMLInfo(const Value& value) {
    const auto blob = getPlistBlob(value);
    if (!blob || !QVReportingIsValidUtf8(
                     std::string_view(reinterpret_cast<const char*>(blob->data()), blob->size()))) {
        return std::nullopt;
    }
    return std::string(blob->begin(), blob->end());
}

std::optional<std::string> DataSerialize::getBase64XMLBlob(const Value& value) {
    const auto blob = getPlistBlob(value);
    if (!blob) {
        return std::nullopt;
    }
    return QVReportingBase64Encode(*blob);
}

}  // namespace qv
