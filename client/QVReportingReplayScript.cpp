#include "QVReportingReplayScript.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <limits>
#include <optional>

#include "QVReportingCtlSupport.h"
#include "QVReportingJsonVariant.h"
#include "values/ValueJson.h"

namespace qv::client {

namespace {

using Kind = QVReportingReplayOperation::Kind;
using Json = nlohmann::ordered_json;

// Longer pauses are almost surely a slip (200 for 0.2) and would look like a hang.
constexpr double kMaxSleepSeconds = 3600;

// Deeper lines are refused before they are parsed: copying and converting JSON recurse once per
// level, so a hostile line could otherwise exhaust the stack.
constexpr int kMaxNesting = 64;

// Keys besides "op"; unused places are empty.
using Keys = std::array<std::string_view, 2>;

struct OperationShape {
    Kind kind;
    std::string_view name;
    Keys required;
    Keys optional;
};

constexpr OperationShape kShapes[] = {
    {Kind::Create, "create", {"id"}, {}},
    {Kind::SetType, "set-type", {"id", "type"}, {}},
    {Kind::GetType, "get-type", {"id"}, {}},
    {Kind::Configure, "configure", {"id", "config"}, {}},
    {Kind::Start, "start", {"id"}, {}},
    {Kind::Send, "send", {"category", "type"}, {"ids", "payload"}},
    {Kind::Stop, "stop", {"id"}, {}},
    {Kind::Destroy, "destroy", {"id"}, {}},
    {Kind::Valid, "valid", {"id"}, {}},
    {Kind::List, "list", {}, {}},
    {Kind::Sleep, "sleep", {"seconds"}, {}},
};

struct Bad {
    std::string message;
};

std::string jsonQuoted(std::string_view s) {
    return Json(std::string(s)).dump(-1, ' ', false, Json::error_handler_t::replace);
}

std::int64_t reporterIDFrom(const Json& json, std::string_view what) {
    if (json.is_number_integer() && !json.is_number_unsigned()) {
        return json.get<std::int64_t>();
    }
    if (json.is_number_unsigned()) {
        const auto u = json.get<std::uint64_t>();
        if (u <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
            return static_cast<std::int64_t>(u);
        }
    }
    throw Bad{std::string(what) + " must be an integer reporter ID (signed 64-bit), not " +
              json.dump()};
}

const OperationShape& shapeFor(const Json& op) {
    if (!op.is_string()) {
        throw Bad{"\"op\" must be a string"};
    }
    const auto name = op.get<std::string>();
    for (const auto& shape : kShapes) {
        if (shape.name == name) {
            return shape;
        }
    }
    std::string known;
    for (const auto& shape : kShapes) {
        known += known.empty() ? "" : ", ";
        known += shape.name;
    }
    throw Bad{"unknown operation " + jsonQuoted(name) + " (known: " + known + ")"};
}

void checkKeys(const Json& object, const OperationShape& shape) {
    for (const auto& item : object.items()) {
        // A named variable, not a structured binding: clang before 16 cannot capture those.
        const std::string& key = item.key();
        if (key == "op") {
            continue;
        }
        const auto listed = [&](const Keys& keys) {
            return !key.empty() && std::find(keys.begin(), keys.end(), key) != keys.end();
        };
        if (!listed(shape.required) && !listed(shape.optional)) {
            throw Bad{"\"" + std::string(shape.name) + "\" takes no key " + jsonQuoted(key)};
        }
    }
    for (std::string_view key : shape.required) {
        if (!key.empty() && !object.contains(key)) {
            throw Bad{"\"" + std::string(shape.name) + "\" needs \"" + std::string(key) + "\""};
        }
    }
}

// Checks now that the dictionary has a D-Bus form, so a bad value fails before anything runs.
void checkDictionary(const Json& json, std::string_view what) {
    QVReportingJsonConversionOptions options;
    options.now = 0;
    try {
        (void)QVReportingJsonToVariantMap(json, options, std::string(what));
    } catch (const QVReportingJsonConversionError& e) {
        throw Bad{e.what()};
    }
}

QVReportingReplayOperation parse(std::string_view text, std::size_t line) {
    if (QVReportingJsonNestsDeeperThan(text, kMaxNesting)) {
        throw Bad{"nested more than " + std::to_string(kMaxNesting) + " deep"};
    }
    // The parser stops at a NUL byte, which JSON never holds: such a line is not JSON.
    const Json object = text.find('\0') == std::string_view::npos
                            ? Json::parse(text.begin(), text.end(), nullptr, false)
                            : Json(Json::value_t::discarded);
    if (object.is_discarded()) {
        throw Bad{"not valid JSON"};
    }
    if (!object.is_object()) {
        throw Bad{"expected a JSON object, found " + std::string(object.type_name())};
    }
    const auto opField = object.find("op");
    if (opField == object.end()) {
        throw Bad{"missing \"op\""};
    }
    const OperationShape& shape = shapeFor(*opField);
    checkKeys(object, shape);

    QVReportingReplayOperation op;
    op.line = line;
    op.kind = shape.kind;
    if (object.contains("id")) {
        op.reporterID = reporterIDFrom(object.at("id"), "\"id\"");
    }
    switch (shape.kind) {
        case Kind::SetType: {
            const auto serviceType = QVReportingCtlParseServiceTypeFromJson(object.at("type"));
            if (!serviceType) {
                throw Bad{
                    "\"type\" must be a service type: a number up to 65535 or a name such "
                    "as \"longformaudio\", not " +
                    object.at("type").dump()};
            }
            op.serviceType = *serviceType;
            break;
        }
        case Kind::Configure:
            op.dictionary = object.at("config");
            checkDictionary(op.dictionary, "config");
            break;
        case Kind::Send: {
            const auto category = QVReportingCtlParseCategoryFromJson(object.at("category"));
            if (!category) {
                throw Bad{
                    "\"category\" must be a number up to 4294967295 or a name such as "
                    "\"Playback\" or \"DSP_Setup\", not " +
                    object.at("category").dump()};
            }
            const auto type = QVReportingCtlParseTypeFromJson(object.at("type"));
            if (!type) {
                throw Bad{
                    "\"type\" must be a number up to 65535 or a name such as \"Start\", "
                    "not " +
                    object.at("type").dump()};
            }
            op.category = *category;
            op.type = *type;
            if (object.contains("ids")) {
                const Json& ids = object.at("ids");
                if (!ids.is_array()) {
                    throw Bad{"\"ids\" must be an array of reporter IDs"};
                }
                for (std::size_t i = 0; i < ids.size(); ++i) {
                    op.reporterIDs.push_back(
                        reporterIDFrom(ids[i], "\"ids\"[" + std::to_string(i) + "]"));
                }
            }
            op.dictionary = object.contains("payload") ? object.at("payload") : Json::object();
            checkDictionary(op.dictionary, "payload");
            break;
        }
        case Kind::Sleep: {
            const Json& seconds = object.at("seconds");
            if (!seconds.is_number()) {
                throw Bad{"\"seconds\" must be a number"};
            }
            op.seconds = seconds.get<double>();
            if (!(op.seconds >= 0 && op.seconds <= kMaxSleepSeconds)) {
                throw Bad{"\"seconds\" must lie between 0 and 3600"};
            }
            break;
        }
        default:
            break;
    }
    return op;
}

}  // namespace

std::string_view QVReportingReplayOperationName(Kind kind) {
    for (const auto& shape : kShapes) {
        if (shape.kind == kind) {
            return shape.name;
        }
    }
    return "?";
}

std::variant<QVReportingReplayOperation, QVReportingReplayError> QVReportingParseReplayLine(
    std::string_view text, std::size_t line) {
    try {
        return parse(text, line);
    } catch (const Bad& bad) {
        return QVReportingReplayError{line, bad.message};
    }
}

std::variant<std::vector<QVReportingReplayOperation>, QVReportingReplayError>
QVReportingParseReplayScript(std::istream& in) {
    std::vector<QVReportingReplayOperation> operations;
    std::string text;
    for (std::size_t line = 1; std::getline(in, text); ++line) {
        if (std::all_of(text.begin(), text.end(),
                        [](unsigned char c) { return c == ' ' || c == '\t' || c == '\r'; })) {
            continue;
        }
        auto parsed = QVReportingParseReplayLine(text, line);
        if (auto* error = std::get_if<QVReportingReplayError>(&parsed)) {
            return *error;
        }
        operations.push_back(std::move(std::get<QVReportingReplayOperation>(parsed)));
    }
    return operations;
}

}  // namespace qv::client
