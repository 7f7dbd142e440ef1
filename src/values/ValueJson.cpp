#include "values/ValueJson.h"

#include <nlohmann/json.hpp>

#include <cmath>
#include <limits>

#include "values/Base64.h"

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

}  // namespace qv
