// The record of an "mtx" sink line, decoded for qvreportctl with the record's own reader and text
// formatter (the daemon's codec, not a second one).
//
// Thread safety: pure functions.
#pragma once

#include <string>

#include <nlohmann/json.hpp>

namespace qv::client {

// Decodes line["record"] (base64 of the wire bytes of an AudioIssueDetected) of one mtx sink line
// object and changes the object for output:
// - for scripts (json): adds "decoded", the record's fields as an object (byte strings as JSON
//   strings), or null with "decode_error" and, when the base64 was readable, "record_hex"; the
//   base64 "record" stays;
// - for people: removes "record" and returns the text to print after the other fields:
//   `AudioIssueDetected { duration: 5 issuetype: "stall" node: "12" rtaidclient: "client" }`,
//   or `record does not decode: 1a 05 61` with the bytes in hexadecimal, or `record is not
//   base64` (then "record" stays, so its text is shown).
std::string QVReportingCtlDecodeMTXRecord(nlohmann::ordered_json& line, bool json);

}  // namespace qv::client
