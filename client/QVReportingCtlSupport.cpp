#include "QVReportingCtlSupport.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <limits>

#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include "QVReportingCtlMTXRecord.h"
#include "platform/SinkSegments.h"
#include "session/QVReportingVocabulary.h"

namespace qv::client {

namespace {

constexpr std::string_view kSinkSuffix = ".jsonl";
constexpr std::string_view kMTXSink = "mtx";

}  // namespace

std::optional<std::uint64_t> QVReportingCtlParseUnsigned(std::string_view text) {
    int base = 10;
    if (text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
        text.remove_prefix(2);
        base = 16;
    }
    if (text.empty() || text[0] == '+' || text[0] == '-') {
        return std::nullopt;
    }
    std::uint64_t value = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value, base);
    if (error != std::errc() || end != text.data() + text.size()) {
        return std::nullopt;
    }
    return value;
}

namespace {

template <typename T>
std::optional<T> bounded(std::optional<std::uint64_t> value) {
    if (!value || *value > std::numeric_limits<T>::max()) {
        return std::nullopt;
    }
    return static_cast<T>(*value);
}

template <typename T>
std::optional<T> unsignedFromJson(const nlohmann::ordered_json& json) {
    if (json.is_number_unsigned()) {
        return bounded<T>(json.get<std::uint64_t>());
    }
    if (json.is_number_integer()) {
        const auto i = json.get<std::int64_t>();
        return i < 0 ? std::nullopt : bounded<T>(static_cast<std::uint64_t>(i));
    }
    return std::nullopt;
}

constexpr AudioEventCategory kPrefixes[] = {
    0,
    category::kPrefixMIDI,
    category::kPrefixSession,
    category::kPrefixDSP,
    category::kPrefixHAL,
    category::kPrefixRouting,
    category::kPrefixToolbox,
};

}  // namespace

// --- Vocabulary ---------------------------------------------------------------------------------

std::optional<std::uint32_t> QVReportingCtlParseCategory(std::string_view text) {
    if (auto number = bounded<std::uint32_t>(QVReportingCtlParseUnsigned(text))) {
        return number;
    }
    // The one name that the daemon reads but never prints ("Undefined" would name every unknown
    // base at once, so it is not taken).
    if (QVReportingUtilityCategoryFromString(text) == category::kUnknown && text == "Unknown") {
        return category::kUnknown;
    }
    // Every name the daemon prints for a known base, with or without a prefix.
    for (AudioEventCategory prefix : kPrefixes) {
        for (AudioEventCategory base = category::kGeneric; base <= category::kEarlink; ++base) {
            if (QVReportingUtilityCategoryString(prefix | base) == text) {
                return prefix | base;
            }
        }
    }
    return std::nullopt;
}

std::optional<std::uint16_t> QVReportingCtlParseType(std::string_view text) {
    if (auto number = bounded<std::uint16_t>(QVReportingCtlParseUnsigned(text))) {
        return number;
    }
    for (AudioEventType t = type::kGeneric; t <= type::kMemoryLog; ++t) {
        if (QVReportingUtilityTypeString(t) == text) {
            return t;
        }
    }
    if (QVReportingUtilityTypeString(type::kUnknown) == text) {
        return type::kUnknown;
    }
    return std::nullopt;
}

std::optional<std::uint16_t> QVReportingCtlParseServiceType(std::string_view text) {
    if (auto number = bounded<std::uint16_t>(QVReportingCtlParseUnsigned(text))) {
        return number;
    }
    // Unknown names map to "unknown" too; only a name that comes back unchanged is one.
    const AudioServiceType serviceType = QVReportingUtilityGenerateServiceTypeFromServiceName(text);
    if (QVReportingUtilityGenerateServiceNameFromServiceType(serviceType) != text) {
        return std::nullopt;
    }
    return serviceType;
}

std::optional<std::uint32_t> QVReportingCtlParseCategoryFromJson(
    const nlohmann::ordered_json& json) {
    return json.is_string() ? QVReportingCtlParseCategory(json.get<std::string>())
                            : unsignedFromJson<std::uint32_t>(json);
}

std::optional<std::uint16_t> QVReportingCtlParseTypeFromJson(const nlohmann::ordered_json& json) {
    return json.is_string() ? QVReportingCtlParseType(json.get<std::string>())
                            : unsignedFromJson<std::uint16_t>(json);
}

std::optional<std::uint16_t> QVReportingCtlParseServiceTypeFromJson(
    const nlohmann::ordered_json& json) {
    return json.is_string() ? QVReportingCtlParseServiceType(json.get<std::string>())
                            : unsignedFromJson<std::uint16_t>(json);
}

std::optional<std::int64_t> QVReportingCtlParseReporterID(std::string_view text) {
    if (text.empty() || text[0] == '+') {
        return std::nullopt;
    }
    std::int64_t value = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
    if (error != std::errc() || end != text.data() + text.size()) {
        return std::nullopt;
    }
    return value;
}

// --- State directory ----------------------------------------------------------------------------

std::string QVReportingCtlDefaultStateDirectory(const QVReportingEnvironment& environment,
                                                unsigned effectiveUserID) {
    if (const char* systemd = environment("STATE_DIRECTORY"); systemd && *systemd) {
        const std::string_view dirs = systemd;
        return std::string(dirs.substr(0, dirs.find(':')));
    }
    if (effectiveUserID == 0) {
        return "/var/lib/qvreportd";
    }
    if (const char* xdg = environment("XDG_STATE_HOME"); xdg && *xdg) {
        return std::string(xdg) + "/qvreportd";
    }
    const char* home = environment("HOME");
    return std::string(home && *home ? home : "/tmp") + "/.local/state/qvreportd";
}

std::string QVReportingCtlDefaultStateDirectory() {
    return QVReportingCtlDefaultStateDirectory([](const char* name) { return std::getenv(name); },
                                               ::geteuid());
}

// --- Sink files ---------------------------------------------------------------------------------

bool QVReportingCtlIsSinkName(std::string_view sink) {
    if (sink.empty() || sink[0] == '.') {
        return false;
    }
    return std::none_of(sink.begin(), sink.end(), [](char c) {
        const auto u = static_cast<unsigned char>(c);
        return c == '/' || u < 0x20 || u == 0x7f;
    });
}

std::string QVReportingCtlSinkPath(const std::string& stateDir, std::string_view sink) {
    return stateDir + "/sinks/" + std::string(sink) + std::string(kSinkSuffix);
}

std::vector<std::string> QVReportingCtlListSinks(const std::string& stateDir) {
    std::vector<std::string> sinks =
        QVReportingListSinks(std::filesystem::path(stateDir) / "sinks");
    std::erase_if(sinks, [](const std::string& sink) { return !QVReportingCtlIsSinkName(sink); });
    return sinks;
}

std::string QVReportingCtlFormatUTC(double secondsSince1970) {
    if (!std::isfinite(secondsSince1970) || std::abs(secondsSince1970) > 1e15) {
        return "(bad time)";
    }
    const double whole = std::floor(secondsSince1970);
    auto milliseconds = static_cast<int>(std::floor((secondsSince1970 - whole) * 1000.0));
    milliseconds = std::clamp(milliseconds, 0, 999);
    const auto t = static_cast<std::time_t>(whole);
    std::tm tm{};
    if (!gmtime_r(&t, &tm)) {
        return "(bad time)";
    }
    return fmt::format("{:04}-{:02}-{:02}T{:02}:{:02}:{:02}.{:03}Z", tm.tm_year + 1900,
                       tm.tm_mon + 1, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec, milliseconds);
}

std::string QVReportingCtlFormatSinkLine(std::string_view sink, std::string_view line, bool json) {
    nlohmann::ordered_json object =
        nlohmann::ordered_json::parse(line.begin(), line.end(), nullptr, false);
    if (!object.is_object()) {
        if (json) {
            nlohmann::ordered_json out = {{"sink", sink}, {"unreadable", line}};
            return out.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace);
        }
        return fmt::format("(unreadable) {} {}", sink, line);
    }
    std::string decodedRecord;
    if (sink == kMTXSink) {
        decodedRecord = QVReportingCtlDecodeMTXRecord(object, json);
    }
    if (json) {
        nlohmann::ordered_json out = {{"sink", sink}};
        for (auto& [key, value] : object.items()) {
            if (key != "sink") {
                out[key] = std::move(value);
            }
        }
        return out.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace);
    }
    std::string time = "(no time)";
    if (auto t = object.find("time"); t != object.end() && t->is_number()) {
        time = QVReportingCtlFormatUTC(t->get<double>());
        object.erase("time");
    }
    std::string text =
        fmt::format("{} {} {}", time, sink,
                    object.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace));
    if (!decodedRecord.empty()) {
        text += ' ';
        text += decodedRecord;
    }
    return text;
}

}  // namespace qv::client
