#include "QVReportingReplayScript.h"

#include <sstream>
#include <string>
#include <variant>

#include <gtest/gtest.h>

namespace qv::client {
namespace {

using Kind = QVReportingReplayOperation::Kind;

QVReportingReplayOperation parsed(const char* line) {
    auto result = QVReportingParseReplayLine(line, 1);
    if (auto* error = std::get_if<QVReportingReplayError>(&result)) {
        ADD_FAILURE() << line << ": " << error->message;
        return {};
    }
    return std::get<QVReportingReplayOperation>(result);
}

// The message of a line that must be refused ("" when it was accepted).
std::string refusal(std::string_view line) {
    auto result = QVReportingParseReplayLine(line, 1);
    auto* error = std::get_if<QVReportingReplayError>(&result);
    return error ? error->message : "";
}

TEST(AReplayScriptParser, ReadsOperationsWithNamesOrNumbers) {
    EXPECT_EQ(parsed(R"({"op":"create","id":-3})").reporterID, -3);
    EXPECT_EQ(parsed(R"({"op":"set-type","id":5,"type":"longformaudio"})").serviceType, 7);
    const auto send = parsed(
        R"({"op":"send","ids":[5,9],"category":"DSP_Setup","type":"Start","payload":{"k":1}})");
    EXPECT_EQ(send.kind, Kind::Send);
    EXPECT_EQ(send.category, 0x10000008u);
    EXPECT_EQ(send.type, 1);
    EXPECT_EQ(send.reporterIDs, (std::vector<std::int64_t>{5, 9}));
    EXPECT_EQ(send.dictionary, nlohmann::ordered_json::parse(R"({"k":1})"));
    // Without ids and payload: every started session and an empty payload; "$now" waits for the
    // run.
    const auto bare = parsed(R"({"op":"send","category":4,"type":0})");
    EXPECT_TRUE(bare.reporterIDs.empty());
    EXPECT_TRUE(bare.dictionary.is_object() && bare.dictionary.empty());
    EXPECT_EQ(parsed(R"({"op":"configure","id":1,"config":{"t":{"$now":-3}}})").dictionary["t"],
              nlohmann::ordered_json::parse(R"({"$now":-3})"));
}

TEST(AReplayScriptParser, RefusesMalformedLinesAndArgumentsOutsideTheirRange) {
    const std::pair<const char*, const char*> refused[] = {
        {R"({"op":"create","id":5)", "not valid JSON"},
        {R"({"id":5})", "missing \"op\""},
        {R"({"op":"begin","id":5})", "unknown operation \"begin\""},
        {R"({"op":"send","catgory":4,"category":4,"type":1})", "\"send\" takes no key \"catgory\""},
        {R"({"op":"stop"})", "\"stop\" needs \"id\""},
        {R"({"op":"send","ids":[5,true],"category":4,"type":1})", "\"ids\"[1]"},
        {R"({"op":"send","category":4,"type":1,"payload":{"a":[null]}})", "payload.a[0]: null"},
        {R"({"op":"configure","id":1,"config":[]})", "config: expected a JSON object"},
        {R"({"op":"create","id":5.5})", ""},
        {R"({"op":"create","id":9223372036854775808})", ""},
        {R"({"op":"set-type","id":1,"type":65536})", ""},
        {R"({"op":"set-type","id":1,"type":"Telephony"})", ""},
        {R"({"op":"send","category":4294967296,"type":1})", ""},
        {R"({"op":"send","category":4,"type":65536})", ""},
        {R"({"op":"sleep","seconds":3600.5})", ""},
        {R"({"op":"sleep","seconds":-0.1})", ""},
    };
    for (const auto& [line, reason] : refused) {
        const std::string message = refusal(line);
        EXPECT_NE(message, "") << line;
        EXPECT_NE(message.find(reason), std::string::npos) << line << ": " << message;
    }
    // The JSON parser stops at a NUL byte; the line must not pass for the part before it.
    EXPECT_NE(refusal(std::string(R"({"op":"create","id":5})") + '\0' + "}").find("not valid JSON"),
              std::string::npos);
    for (const char* line : {R"({"op":"create","id":9223372036854775807})",
                             R"({"op":"send","category":4294967295,"type":65535})",
                             R"({"op":"sleep","seconds":3600})"}) {
        EXPECT_EQ(refusal(line), "") << line;
    }
}

// A payload of n nested dictionaries inside the line's own object and its payload.
std::string nestedSend(std::size_t n) {
    std::string payload = "1";
    for (std::size_t i = 0; i < n; ++i) {
        payload = R"({"a":)" + payload + "}";
    }
    return R"({"op":"send","category":1,"type":1,"payload":{"a":)" + payload + "}}";
}

TEST(AReplayScriptParser, RefusesLinesNestedTooDeepWithoutExhaustingTheStack) {
    // 2 + 62 levels is the most a line may hold, though the bus refuses a payload this deep:
    // refused, not thrown. Brackets inside strings do not count.
    EXPECT_NE(refusal(nestedSend(62).c_str()).find("payload: has no D-Bus form"),
              std::string::npos);
    EXPECT_EQ(refusal(nestedSend(30).c_str()), "");
    EXPECT_NE(refusal(nestedSend(63).c_str()).find("nested more than 64 deep"), std::string::npos);
    const std::string quoted =
        R"({"op":"send","category":1,"type":1,"payload":{"a":")" + std::string(100, '[') + R"("}})";
    EXPECT_EQ(refusal(quoted.c_str()), "");
    // Deep enough to overflow the stack once copied or converted.
    const std::string hostile = R"({"op":"send","category":1,"type":1,"payload":{"a":)" +
                                std::string(200000, '[') + std::string(200000, ']') + "}}";
    EXPECT_NE(refusal(hostile.c_str()).find("nested more than 64 deep"), std::string::npos);
    std::istringstream script(R"({"op":"list"})"
                              "\n" +
                              nestedSend(63) + "\n");
    const auto result = QVReportingParseReplayScript(script);
    ASSERT_TRUE(std::holds_alternative<QVReportingReplayError>(result));
    EXPECT_EQ(std::get<QVReportingReplayError>(result).line, 2u);
}

}  // namespace
}  // namespace qv::client
