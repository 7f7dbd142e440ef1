#include "QVReportingJsonVariant.h"

#include <cmath>
#include <cstdint>
#include <limits>
#include <vector>

#include <sdbus-c++/Error.h>
#include <sdbus-c++/Message.h>

// Exported by libsdbus-c++ 1.2 (variants are built on it) but declared in its public headers only
// by later versions; the declaration below matches both.
namespace sdbus {
PlainMessage createPlainMessage();
}

namespace qv::client {

namespace {

constexpr const char* kNowKey = "$now";

// The bus refuses some values JSON can hold (containers nested deeper than a message may go,
// strings holding NUL): they have no D-Bus form either.
QVReportingJsonConversionError noDBusForm(const std::string& path, const sdbus::Error& e) {
    return QVReportingJsonConversionError(path + ": has no D-Bus form (" + e.getMessage() + ")");
}

sdbus::Variant toVariant(const nlohmann::ordered_json& json,
                         const QVReportingJsonConversionOptions& options, const std::string& path,
                         std::size_t depth);

VariantMap toVariantMap(const nlohmann::ordered_json& json,
                        const QVReportingJsonConversionOptions& options, const std::string& path,
                        std::size_t depth) {
    if (!json.is_object()) {
        throw QVReportingJsonConversionError(path + ": expected a JSON object, found " +
                                             std::string(json.type_name()));
    }
    VariantMap map;
    for (const auto& [key, value] : json.items()) {
        map.emplace(key, toVariant(value, options, path + "." + key, depth + 1));
    }
    return map;
}

sdbus::Variant toVariant(const nlohmann::ordered_json& json,
                         const QVReportingJsonConversionOptions& options, const std::string& path,
                         std::size_t depth) {
    if (depth > options.maxDepth) {
        throw QVReportingJsonConversionError(path + ": nested more than " +
                                             std::to_string(options.maxDepth) + " deep");
    }
    switch (json.type()) {
        case nlohmann::ordered_json::value_t::boolean:
            return sdbus::Variant(json.get<bool>());
        case nlohmann::ordered_json::value_t::number_integer:
            return sdbus::Variant(json.get<std::int64_t>());
        case nlohmann::ordered_json::value_t::number_unsigned: {
            const auto u = json.get<std::uint64_t>();
            if (u <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
                return sdbus::Variant(static_cast<std::int64_t>(u));
            }
            return sdbus::Variant(u);
        }
        case nlohmann::ordered_json::value_t::number_float:
            return sdbus::Variant(json.get<double>());
        case nlohmann::ordered_json::value_t::string:
            return sdbus::Variant(json.get<std::string>());
        case nlohmann::ordered_json::value_t::array: {
            std::vector<sdbus::Variant> items;
            items.reserve(json.size());
            for (std::size_t i = 0; i < json.size(); ++i) {
                items.push_back(
                    toVariant(json[i], options, path + "[" + std::to_string(i) + "]", depth + 1));
            }
            return sdbus::Variant(items);
        }
        case nlohmann::ordered_json::value_t::object: {
            if (json.size() == 1 && json.contains(kNowKey)) {
                const auto& offset = json[kNowKey];
                if (!offset.is_number()) {
                    throw QVReportingJsonConversionError(path + ": {\"$now\": OFFSET} needs a " +
                                                         "number of seconds");
                }
                if (!options.now) {
                    throw QVReportingJsonConversionError(
                        path + ": {\"$now\": OFFSET} is not understood here");
                }
                return sdbus::Variant(*options.now + offset.get<double>());
            }
            return sdbus::Variant(toVariantMap(json, options, path, depth));
        }
        case nlohmann::ordered_json::value_t::null:
            throw QVReportingJsonConversionError(path + ": null has no D-Bus form");
        case nlohmann::ordered_json::value_t::binary:
        case nlohmann::ordered_json::value_t::discarded:
            break;
    }
    throw QVReportingJsonConversionError(path + ": a value of type " +
                                         std::string(json.type_name()) + " has no D-Bus form");
}

// Reads one complete value at the message's position, or returns false at the end of the
// current container.
bool readValue(sdbus::Message& m, nlohmann::ordered_json& out);

template <typename T>
nlohmann::ordered_json readAs(sdbus::Message& m) {
    T value{};
    m >> value;
    return nlohmann::ordered_json(value);
}

nlohmann::ordered_json readArray(sdbus::Message& m, const std::string& contents) {
    m.enterContainer(contents);
    nlohmann::ordered_json out;
    if (!contents.empty() && contents[0] == '{') {
        const std::string entry = contents.substr(1, contents.size() - 2);
        const bool stringKeys = entry[0] == 's' || entry[0] == 'o' || entry[0] == 'g';
        out = stringKeys ? nlohmann::ordered_json::object() : nlohmann::ordered_json::array();
        while (m.enterDictEntry(entry)) {
            nlohmann::ordered_json key, value;
            readValue(m, key);
            readValue(m, value);
            m.exitDictEntry();
            if (stringKeys) {
                out[key.get<std::string>()] = std::move(value);
            } else {
                out.push_back(nlohmann::ordered_json::array({std::move(key), std::move(value)}));
            }
        }
        // A failed enter marks the message; the container itself is fine.
        m.clearFlags();
    } else {
        out = nlohmann::ordered_json::array();
        nlohmann::ordered_json item;
        while (readValue(m, item)) {
            out.push_back(std::move(item));
        }
    }
    m.exitContainer();
    return out;
}

bool readValue(sdbus::Message& m, nlohmann::ordered_json& out) {
    std::string type, contents;
    m.peekType(type, contents);
    if (type.empty() || type[0] == '\0') {
        return false;
    }
    switch (type[0]) {
        case 'b':
            out = readAs<bool>(m);
            return true;
        case 'y':
            out = readAs<std::uint8_t>(m);
            return true;
        case 'n':
            out = readAs<std::int16_t>(m);
            return true;
        case 'q':
            out = readAs<std::uint16_t>(m);
            return true;
        case 'i':
            out = readAs<std::int32_t>(m);
            return true;
        case 'u':
            out = readAs<std::uint32_t>(m);
            return true;
        case 'x':
            out = readAs<std::int64_t>(m);
            return true;
        case 't':
            out = readAs<std::uint64_t>(m);
            return true;
        case 'd': {
            double d = 0;
            m >> d;
            // JSON has no NaN or infinity.
            out = std::isfinite(d) ? nlohmann::ordered_json(d) : nlohmann::ordered_json();
            return true;
        }
        case 's':
            out = readAs<std::string>(m);
            return true;
        case 'o': {
            sdbus::ObjectPath path;
            m >> path;
            out = static_cast<const std::string&>(path);
            return true;
        }
        case 'g': {
            sdbus::Signature signature;
            m >> signature;
            out = static_cast<const std::string&>(signature);
            return true;
        }
        case 'h': {
            sdbus::UnixFd fd;
            m >> fd;
            out = "<fd>";
            return true;
        }
        case 'v':
            m.enterVariant(contents);
            if (!readValue(m, out)) {
                out = nullptr;
            }
            m.exitVariant();
            return true;
        case 'a':
            out = readArray(m, contents);
            return true;
        case 'r': {
            m.enterStruct(contents);
            out = nlohmann::ordered_json::array();
            nlohmann::ordered_json item;
            while (readValue(m, item)) {
                out.push_back(std::move(item));
            }
            m.exitStruct();
            return true;
        }
        default:
            throw QVReportingJsonConversionError("a D-Bus value of type '" + type +
                                                 "' cannot be shown");
    }
}

}  // namespace

sdbus::Variant QVReportingJsonToVariant(const nlohmann::ordered_json& json,
                                        const QVReportingJsonConversionOptions& options,
                                        const std::string& path) {
    try {
        return toVariant(json, options, path, 0);
    } catch (const sdbus::Error& e) {
        throw noDBusForm(path, e);
    }
}

VariantMap QVReportingJsonToVariantMap(const nlohmann::ordered_json& json,
                                       const QVReportingJsonConversionOptions& options,
                                       const std::string& path) {
    try {
        return toVariantMap(json, options, path, 0);
    } catch (const sdbus::Error& e) {
        throw noDBusForm(path, e);
    }
}

nlohmann::ordered_json QVReportingVariantToJson(const sdbus::Variant& variant) {
    if (variant.isEmpty()) {
        return nullptr;
    }
    // A variant can only be read as a type named at compile time; copied into a message of its
    // own it can be walked whatever it holds.
    auto message = sdbus::createPlainMessage();
    variant.serializeTo(message);
    message.seal();
    message.rewind(true);
    nlohmann::ordered_json out;
    if (!readValue(message, out)) {
        return nullptr;
    }
    return out;
}

nlohmann::ordered_json QVReportingVariantMapToJson(const VariantMap& map) {
    auto out = nlohmann::ordered_json::object();
    for (const auto& [key, value] : map) {
        out[key] = QVReportingVariantToJson(value);
    }
    return out;
}

}  // namespace qv::client
