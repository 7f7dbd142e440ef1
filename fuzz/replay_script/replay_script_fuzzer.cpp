// QVReportingParseReplayScript on any text, line by line as qvreportctl replay reads it.
//
// Properties:
// - nothing escapes the parser, whatever the text;
// - a script it accepts has one operation per line that is not blank, in order, each carrying
//   its own line number and equal to what QVReportingParseReplayLine gives for that line alone;
//   the line is a JSON object whose "op" names the operation's kind; sleeps lie within 0..3600 s;
//   payloads and configurations are JSON objects;
// - every accepted operation, written back as a script line of its own, parses to the same
//   operation (numbers for categories and types, the same ids, payload and seconds);
// - a script it refuses names a line that is not blank, whose own parse gives the same message,
//   and before which every line that is not blank parses (the first bad line is the one named).
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <sstream>
#include <string>
#include <variant>
#include <vector>

#include "QVReportingReplayScript.h"
#include "common/FuzzSupport.h"

namespace {

using qv::client::QVReportingParseReplayLine;
using qv::client::QVReportingReplayError;
using qv::client::QVReportingReplayOperation;
using qv::fuzz::check;
using Kind = QVReportingReplayOperation::Kind;
using Json = nlohmann::ordered_json;

bool blank(const std::string& line) {
    return line.find_first_not_of(" \t\r") == std::string::npos;
}

bool same(const QVReportingReplayOperation& a, const QVReportingReplayOperation& b) {
    return a.line == b.line && a.kind == b.kind && a.reporterID == b.reporterID &&
           a.serviceType == b.serviceType && a.category == b.category && a.type == b.type &&
           a.reporterIDs == b.reporterIDs && a.dictionary == b.dictionary &&
           std::memcmp(&a.seconds, &b.seconds, sizeof a.seconds) == 0;
}

bool takesID(Kind kind) {
    return kind != Kind::Send && kind != Kind::List && kind != Kind::Sleep;
}

// The operation as a script line of its own.
std::string lineOf(const QVReportingReplayOperation& op) {
    Json line = Json::object();
    line["op"] = std::string(qv::client::QVReportingReplayOperationName(op.kind));
    if (takesID(op.kind)) {
        line["id"] = op.reporterID;
    }
    switch (op.kind) {
        case Kind::SetType:
            line["type"] = op.serviceType;
            break;
        case Kind::Configure:
            line["config"] = op.dictionary;
            break;
        case Kind::Send:
            line["category"] = op.category;
            line["type"] = op.type;
            line["ids"] = op.reporterIDs;
            line["payload"] = op.dictionary;
            break;
        case Kind::Sleep:
            line["seconds"] = op.seconds;
            break;
        default:
            break;
    }
    return line.dump();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string text(reinterpret_cast<const char*>(data), size);
    std::vector<std::string> lines;
    {
        std::istringstream split(text);
        for (std::string line; std::getline(split, line);) {
            lines.push_back(line);
        }
    }
    std::istringstream in(text);
    const auto parsed = qv::client::QVReportingParseReplayScript(in);

    if (const auto* error = std::get_if<QVReportingReplayError>(&parsed)) {
        check(error->line >= 1 && error->line <= lines.size());
        check(!blank(lines[error->line - 1]) && !error->message.empty());
        const auto alone = QVReportingParseReplayLine(lines[error->line - 1], error->line);
        const auto* again = std::get_if<QVReportingReplayError>(&alone);
        check(again != nullptr && again->line == error->line && again->message == error->message);
        for (std::size_t i = 0; i + 1 < error->line; ++i) {
            check(blank(lines[i]) || std::holds_alternative<QVReportingReplayOperation>(
                                         QVReportingParseReplayLine(lines[i], i + 1)));
        }
        return 0;
    }

    const auto& operations = std::get<std::vector<QVReportingReplayOperation>>(parsed);
    std::size_t next = 0;
    for (std::size_t i = 0; i < lines.size(); ++i) {
        if (blank(lines[i])) {
            continue;
        }
        check(next < operations.size());
        const QVReportingReplayOperation& op = operations[next++];
        check(op.line == i + 1);
        const auto alone = QVReportingParseReplayLine(lines[i], i + 1);
        const auto* same1 = std::get_if<QVReportingReplayOperation>(&alone);
        check(same1 != nullptr && same(*same1, op));

        const Json json = Json::parse(lines[i], nullptr, /*allow_exceptions=*/false);
        check(json.is_object() && json.contains("op") && json.at("op").is_string());
        check(json.at("op").get<std::string>() ==
              qv::client::QVReportingReplayOperationName(op.kind));
        if (op.kind == Kind::Sleep) {
            check(op.seconds >= 0 && op.seconds <= 3600);
        }
        if (op.kind == Kind::Send || op.kind == Kind::Configure) {
            check(op.dictionary.is_object());
        }

        const auto rewritten = QVReportingParseReplayLine(lineOf(op), op.line);
        const auto* back = std::get_if<QVReportingReplayOperation>(&rewritten);
        check(back != nullptr && same(*back, op));
    }
    check(next == operations.size());
    return 0;
}
