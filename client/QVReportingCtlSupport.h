// qvreportctl's helpers that need no bus: reading categories, types and service types as
// numbers or vocabulary names, the state directory the daemon settles on, and reading and
// printing its sink files.
//
// Thread safety: the free functions are pure (apart from reading files).
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include <nlohmann/json.hpp>

namespace qv::client {

// --- Vocabulary ---------------------------------------------------------------------------------

// A decimal or 0x-hexadecimal number within the type's range, or a name exactly as the daemon
// spells it: categories with their prefix ("Playback", "DSP_Setup", "Earlink", "Unknown"),
// types ("Start", "MemoryLog", "Unknown"), service types ("longformaudio", "unknown"). Nothing
// for anything else.
std::optional<std::uint32_t> QVReportingCtlParseCategory(std::string_view text);
std::optional<std::uint16_t> QVReportingCtlParseType(std::string_view text);
std::optional<std::uint16_t> QVReportingCtlParseServiceType(std::string_view text);
// The same from JSON: a number or a string.
std::optional<std::uint32_t> QVReportingCtlParseCategoryFromJson(
    const nlohmann::ordered_json& json);
std::optional<std::uint16_t> QVReportingCtlParseTypeFromJson(const nlohmann::ordered_json& json);
std::optional<std::uint16_t> QVReportingCtlParseServiceTypeFromJson(
    const nlohmann::ordered_json& json);
// A decimal or 0x-hexadecimal number in the unsigned 64-bit range (notification states).
std::optional<std::uint64_t> QVReportingCtlParseUnsigned(std::string_view text);
// A reporter ID: a decimal integer in the signed 64-bit range.
std::optional<std::int64_t> QVReportingCtlParseReporterID(std::string_view text);

// --- State directory ----------------------------------------------------------------------------

using QVReportingEnvironment = std::function<const char*(const char* name)>;

// The daemon's rule: $STATE_DIRECTORY (the first of its ':'-separated list), else
// /var/lib/qvreportd for root (effective user 0), else $XDG_STATE_HOME/qvreportd, else
// $HOME/.local/state/qvreportd (with /tmp for a missing HOME).
std::string QVReportingCtlDefaultStateDirectory(const QVReportingEnvironment& environment,
                                                unsigned effectiveUserID);
std::string QVReportingCtlDefaultStateDirectory();

// --- Sink files ---------------------------------------------------------------------------------

// The sinks with a current file or closed segments in <stateDir>/sinks ("analytics" for
// analytics.jsonl and analytics.000000000001.jsonl), sorted.
std::vector<std::string> QVReportingCtlListSinks(const std::string& stateDir);
std::string QVReportingCtlSinkPath(const std::string& stateDir, std::string_view sink);
// A sink name the daemon could have written: not empty, no '/', no leading '.', no control
// characters.
bool QVReportingCtlIsSinkName(std::string_view sink);

// One sink line for output. For people: "<UTC time> <sink> <the other fields as JSON>", the
// "time" field shown as an ISO 8601 date; for scripts: the line's object with "sink" first. An
// "mtx" line's "record" (base64 of the metric's wire bytes) is shown decoded as an
// AudioIssueDetected (see QVReportingCtlDecodeMTXRecord). A line that is not a JSON object is
// shown as it is, marked unreadable.
std::string QVReportingCtlFormatSinkLine(std::string_view sink, std::string_view line, bool json);

// "2024-05-01T12:30:45.250Z" for seconds since 1970 (milliseconds rounded down).
std::string QVReportingCtlFormatUTC(double secondsSince1970);

}  // namespace qv::client
