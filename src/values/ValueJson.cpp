#include "values/ValueJson.h"

#include <nlohmann/json.hpp>

#include <charconv>
#include <cmath>
#include <limits>

#include "values/Base64.h"
#include "values/Utf8.h"

namespace qv {

namespace {

nlohmann::ordered_json finiteOrNull(double d) {
    return std::isfinite(d) ? nlohmann::ordered_json(d) : nlohmann::ordered_json(nullptr);
}

template <typename Json>
Dictionary dictionaryFromObject(const Json& json);

template <typename Json>
Value valueFromJson(const Json& json) {
    using T = nlohmann::detail::value_t;
    switch (json.type()) {
        case T::null:
        case T::discarded:
            return Value();
        case T::boolean:
            return Value(json.template get<bool>());
        case T::number_integer:
            return Value(json.template get<std::int64_t>());
        case T::number_unsigned: {
            // The parser reads every non-negative integer as unsigned. Those that fit a signed
            // integer stay Int, as the same number sent over the bus would be, so that a value
            // keeps its kind through a file; only the larger ones need UInt.
            const auto u = json.template get<std::uint64_t>();
            if (u <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
                return Value(static_cast<std::int64_t>(u));
            }
            return Value(u);
        }
        case T::number_float:
            return Value(json.template get<double>());
        case T::string:
            return Value(json.template get_ref<const typename Json::string_t&>());
        case T::binary: {
            const auto& binary = json.get_binary();
            return Value(Bytes(binary.begin(), binary.end()));
        }
        case T::array: {
            Array array;
            array.reserve(json.size());
            for (const auto& item : json) {
                array.push_back(valueFromJson(item));
            }
            return Value(std::move(array));
        }
        case T::object:
            return Value(dictionaryFromObject(json));
    }
    return Value();
}

template <typename Json>
Dictionary dictionaryFromObject(const Json& json) {
    Dictionary dictionary;
    if (!json.is_object()) {
        return dictionary;
    }
    dictionary.reserve(json.size());
    for (auto it = json.begin(); it != json.end(); ++it) {
        dictionary.set(it.key(), valueFromJson(it.value()));
    }
    return dictionary;
}

}  // namespace

nlohmann::ordered_json QVReportingValueToJson(const Value& value) {
    using K = Value::Kind;
    switch (value.kind()) {
        case K::Null:
            return nullptr;
        case K::Bool:
            return value.boolValue();
        case K::Int:
            return *value.asInt64();
        case K::UInt:
            return *value.asUInt64();
        case K::Double:
            return finiteOrNull(*value.asDouble());
        case K::String:
            return *value.asString();
        case K::Bytes:
            return QVReportingBase64Encode(*value.asBytes());
        case K::Date:
            return finiteOrNull(value.asDate()->secondsSince1970);
        case K::Array: {
            nlohmann::ordered_json array = nlohmann::ordered_json::array();
            for (const Value& item : *value.asArray()) {
                array.push_back(QVReportingValueToJson(item));
            }
            return array;
        }
        case K::Dictionary:
            return QVReportingDictionaryToJson(*value.asDictionary());
    }
    return nullptr;
}

nlohmann::ordered_json QVReportingDictionaryToJson(const Dictionary& dictionary) {
    nlohmann::ordered_json object = nlohmann::ordered_json::object();
    // Keys in a Dictionary are unique, so entries are appended straight to the object's list:
    // inserting by key would search that list each time, quadratic in large payloads.
    auto& entries = object.get_ref<nlohmann::ordered_json::object_t&>();
    entries.reserve(dictionary.size());
    for (const auto& [key, value] : dictionary) {
        entries.emplace_back(key, QVReportingValueToJson(value));
    }
    return object;
}

namespace {

// Escapes as nlohmann does with ensure_ascii off: quote, backslash and control characters only.
// False when text is not valid UTF-8.
bool appendJsonString(std::string& out, std::string_view text) {
    static constexpr char kHex[] = "0123456789abcdef";
    out += '"';
    std::size_t i = 0;
    while (i < text.size()) {
        // Plain characters go across in runs.
        std::size_t plain = i;
        while (plain < text.size()) {
            const auto p = static_cast<unsigned char>(text[plain]);
            if (p < 0x20 || p >= 0x80 || p == '"' || p == '\\') {
                break;
            }
            ++plain;
        }
        out.append(text.data() + i, plain - i);
        i = plain;
        if (i == text.size()) {
            break;
        }
        const auto c = static_cast<unsigned char>(text[i]);
        if (c >= 0x80) {
            const std::size_t length = QVReportingUtf8SequenceLength(text, i);
            if (length == 0) {
                return false;
            }
            out.append(text.substr(i, length));
            i += length;
            continue;
        }
        switch (c) {
            case '"':
                out += "\\\"";
                break;
            case '\\':
                out += "\\\\";
                break;
            case '\b':
                out += "\\b";
                break;
            case '\f':
                out += "\\f";
                break;
            case '\n':
                out += "\\n";
                break;
            case '\r':
                out += "\\r";
                break;
            case '\t':
                out += "\\t";
                break;
            default:
                if (c < 0x20) {
                    out += "\\u00";
                    out += kHex[c >> 4];
                    out += kHex[c & 0xF];
                } else {
                    out += static_cast<char>(c);
                }
        }
        ++i;
    }
    out += '"';
    return true;
}

void appendJsonNumber(std::string& out, double d) {
    if (!std::isfinite(d)) {
        out += "null";
        return;
    }
    // nlohmann's own shortest round-trip form, so that both writers agree to the byte.
    char buffer[64];
    char* end = nlohmann::detail::to_chars(buffer, buffer + sizeof buffer, d);
    out.append(buffer, end);
}

template <typename Integer>
void appendInteger(std::string& out, Integer n) {
    char buffer[24];
    const auto result = std::to_chars(buffer, buffer + sizeof buffer, n);
    out.append(buffer, result.ptr);
}

void appendNewline(std::string& out, int indent, int depth) {
    out += '\n';
    out.append(static_cast<std::size_t>(indent * depth), ' ');
}

// The items between open and close, one a line when indenting; an empty container stays on
// its line ("[]", "{}"), as nlohmann lays them out.
template <typename Items, typename WriteItem>
bool appendContainer(std::string& out, char open, char close, const Items& items, int indent,
                     int depth, WriteItem writeItem) {
    out += open;
    bool first = true;
    for (const auto& item : items) {
        if (!first) {
            out += ',';
        }
        first = false;
        if (indent >= 0) {
            appendNewline(out, indent, depth + 1);
        }
        if (!writeItem(item)) {
            return false;
        }
    }
    if (indent >= 0 && !first) {
        appendNewline(out, indent, depth);
    }
    out += close;
    return true;
}

bool appendJsonText(std::string& out, const Value& value, int indent, int depth) {
    using K = Value::Kind;
    switch (value.kind()) {
        case K::Null:
            out += "null";
            return true;
        case K::Bool:
            out += value.boolValue() ? "true" : "false";
            return true;
        case K::Int:
            appendInteger(out, *value.asInt64());
            return true;
        case K::UInt:
            appendInteger(out, *value.asUInt64());
            return true;
        case K::Double:
            appendJsonNumber(out, *value.asDouble());
            return true;
        case K::Date:
            appendJsonNumber(out, value.asDate()->secondsSince1970);
            return true;
        case K::String:
            return appendJsonString(out, *value.asString());
        case K::Bytes:
            return appendJsonString(out, QVReportingBase64Encode(*value.asBytes()));
        case K::Array:
            return appendContainer(
                out, '[', ']', *value.asArray(), indent, depth,
                [&](const Value& item) { return appendJsonText(out, item, indent, depth + 1); });
        case K::Dictionary:
            return appendContainer(out, '{', '}', *value.asDictionary(), indent, depth,
                                   [&](const auto& entry) {
                                       if (!appendJsonString(out, entry.first)) {
                                           return false;
                                       }
                                       out += indent >= 0 ? ": " : ":";
                                       return appendJsonText(out, entry.second, indent, depth + 1);
                                   });
    }
    out += "null";
    return true;
}

}  // namespace

bool QVReportingAppendJsonString(std::string& out, std::string_view text) {
    const std::size_t before = out.size();
    if (!appendJsonString(out, text)) {
        out.resize(before);
        return false;
    }
    return true;
}

bool QVReportingAppendJsonText(std::string& out, const Value& value, int indent) {
    const std::size_t before = out.size();
    if (!appendJsonText(out, value, indent, 0)) {
        out.resize(before);
        return false;
    }
    return true;
}

Value QVReportingValueFromJson(const nlohmann::ordered_json& json) {
    return valueFromJson(json);
}
Value QVReportingValueFromJson(const nlohmann::json& json) {
    return valueFromJson(json);
}

Dictionary QVReportingDictionaryFromJson(const nlohmann::ordered_json& json) {
    return dictionaryFromObject(json);
}
Dictionary QVReportingDictionaryFromJson(const nlohmann::json& json) {
    return dictionaryFromObject(json);
}

bool QVReportingJsonNestsDeeperThan(std::string_view text, int limit) {
    int depth = 0;
    bool inString = false;
    for (std::size_t i = 0; i < text.size(); ++i) {
        const char c = text[i];
        if (inString) {
            if (c == '\\') {
                ++i;
            } else if (c == '"') {
                inString = false;
            }
        } else if (c == '"') {
            inString = true;
        } else if (c == '[' || c == '{') {
            if (++depth > limit) {
                return true;
            }
        } else if (c == ']' || c == '}') {
            --depth;
        }
    }
    return false;
}

}  // namespace qv
