// Payload values as JSON and back, for the files the daemon writes and reads (sink lines,
// defaults stores, replayed sessions).
//
// To JSON: integers exactly (unsigned 64-bit included), doubles with every digit needed to read
// them back, bytes as base64 text, dates as seconds since 1970 (a double), doubles and dates that
// are not finite as null (JSON has no NaN or infinity), dictionaries as objects in insertion
// order. From JSON: integers that fit a signed 64-bit integer become Int, larger ones UInt;
// fractions become Double; objects become Dictionary in the order of the object (the order of
// the source text for ordered_json, sorted for json).
//
// Strings go across as they are: a string that is not valid UTF-8 makes nlohmann's dump() throw
// unless the writer passes an error handler (error_handler_t::replace).
//
// Conversions recurse once per level of nesting; client payloads reach here already bounded in
// depth by the input limits.
//
// Thread safety: pure functions.
#pragma once

#include <nlohmann/json_fwd.hpp>

#include <string_view>

#include "values/Value.h"

namespace qv {

nlohmann::ordered_json QVReportingValueToJson(const Value& value);
nlohmann::ordered_json QVReportingDictionaryToJson(const Dictionary& dictionary);

// Appends the JSON text of value to out, exactly as nlohmann's dump(indent) writes
// QVReportingValueToJson(value), without building that JSON value first (the writers of large
// files and of every sink line spend most of their time there). indent < 0 is the compact form.
// False, with out as it was, when a string is not valid UTF-8: the caller decides what to do.
bool QVReportingAppendJsonText(std::string& out, const Value& value, int indent = -1);
// The same for one string (a key, say), without making a Value of it.
bool QVReportingAppendJsonString(std::string& out, std::string_view text);

// True when JSON text nests arrays and objects more than limit deep (strings skipped), checked
// before parsing: the parser recurses once per level, so text from outside is refused first.
bool QVReportingJsonNestsDeeperThan(std::string_view text, int limit);

Value QVReportingValueFromJson(const nlohmann::ordered_json& json);
Value QVReportingValueFromJson(const nlohmann::json& json);
// The object as a dictionary; an empty dictionary when json is not an object.
Dictionary QVReportingDictionaryFromJson(const nlohmann::ordered_json& json);
Dictionary QVReportingDictionaryFromJson(const nlohmann::json& json);

}  // namespace qv
