// Session scripts for `qvreportctl replay`: JSON lines, one operation each, e.g.
//
//   {"op":"create","id":5}
//   {"op":"set-type","id":5,"type":"longformaudio"}          (or a number)
//   {"op":"configure","id":5,"config":{"KXHostApplicationDisplayID":"com.example.music"}}
//   {"op":"start","id":5}                                     (its reply arrives at stop)
//   {"op":"send","ids":[5],"category":"Playback","type":"Start","payload":{...}}
//   {"op":"stop","id":5}
//   {"op":"destroy","id":5}
//   {"op":"sleep","seconds":0.2}
//
// and "get-type", "valid" (with "id") and "list". "ids" may be left out or empty (every started
// session, or the shared single-message session). Categories and types are numbers or names;
// payloads and configurations follow QVReportingJsonVariant.h, {"$now": OFFSET} included, which
// is resolved when the line runs, not when it is read. Blank lines are skipped.
//
// The whole script is checked before anything runs: a line that is not a JSON object, an
// unknown operation or key, a missing or mistyped argument, a value with no D-Bus form, or
// nesting more than 64 deep fails with its line number.
//
// Thread safety: pure functions.
#pragma once

#include <cstddef>
#include <cstdint>
#include <istream>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include <nlohmann/json.hpp>

namespace qv::client {

struct QVReportingReplayOperation {
    enum class Kind {
        Create,
        SetType,
        GetType,
        Configure,
        Start,
        Send,
        Stop,
        Destroy,
        Valid,
        List,
        Sleep
    };

    std::size_t line = 0;  // from 1
    Kind kind = Kind::Create;
    std::int64_t reporterID = 0;            // every kind that takes "id"
    std::uint16_t serviceType = 0;          // set-type
    std::uint32_t category = 0;             // send
    std::uint16_t type = 0;                 // send
    std::vector<std::int64_t> reporterIDs;  // send
    nlohmann::ordered_json dictionary;      // configure: "config"; send: "payload"
    double seconds = 0;                     // sleep
};

struct QVReportingReplayError {
    std::size_t line = 0;
    std::string message;
};

// "create", "set-type", ... as scripts spell them.
std::string_view QVReportingReplayOperationName(QVReportingReplayOperation::Kind kind);

// One line (blank lines are not operations; the caller skips them).
std::variant<QVReportingReplayOperation, QVReportingReplayError> QVReportingParseReplayLine(
    std::string_view text, std::size_t line);

// A whole script, or the first bad line.
std::variant<std::vector<QVReportingReplayOperation>, QVReportingReplayError>
QVReportingParseReplayScript(std::istream& in);

}  // namespace qv::client
