#include "QVReportingCtlMTXRecord.h"

#include <gtest/gtest.h>

#include <string>

#include "QVReportingCtlSupport.h"
#include "values/Base64.h"

namespace qv::client {
namespace {

using namespace std::string_literals;
using Json = nlohmann::ordered_json;

std::string mtxLine(const std::string& wire) {
    return R"({"time":1714566645.25,"metric":5963779,"record":")" +
           QVReportingBase64Encode(Bytes(wire.begin(), wire.end())) + "\"}";
}

TEST(AnMTXSinkLine, ShowsItsRecordDecodedForPeopleAndForScripts) {
    const std::string wire =
        "\x10\xfb\xff\xff\xff\xff\xff\xff\xff\xff\x01\x1a\x05stall"
        "\x22\x02"
        "12\x2a\x03\x63\"\xff\x08\x07"s;
    EXPECT_EQ(QVReportingCtlFormatSinkLine("mtx", mtxLine(wire), false),
              "2024-05-01T12:30:45.250Z mtx {\"metric\":5963779} AudioIssueDetected { duration: -5 "
              "issuetype: \"stall\" node: \"12\" rtaidclient: \"c\\\"\\377\" timestamp: 7 }");
    const Json json = Json::parse(QVReportingCtlFormatSinkLine("mtx", mtxLine(wire), true));
    EXPECT_EQ(json["sink"], "mtx");
    EXPECT_EQ(json["record"], Json::parse(mtxLine(wire))["record"]) << "exact bytes for scripts";
    EXPECT_EQ(
        json["decoded"].dump(),
        R"({"duration":-5,"issuetype":"stall","node":"12","rtaidclient":"c\"�","timestamp":7})");

    // No bytes at all is an empty record.
    EXPECT_EQ(QVReportingCtlFormatSinkLine("mtx", mtxLine(""), false),
              "2024-05-01T12:30:45.250Z mtx {\"metric\":5963779} AudioIssueDetected { duration: 0 "
              "issuetype: \"\" node: \"\" rtaidclient: \"\" }");
}

TEST(AnMTXSinkLine, ShowsARecordThatDoesNotDecodeWithItsBytes) {
    // A string cut short, then a record that is not base64 at all.
    const std::string cut = "\x10\x01\x1a\x05st"s;
    EXPECT_EQ(QVReportingCtlFormatSinkLine("mtx", mtxLine(cut), false),
              "2024-05-01T12:30:45.250Z mtx {\"metric\":5963779} record does not decode: "
              "10 01 1a 05 73 74");
    Json json = Json::parse(QVReportingCtlFormatSinkLine("mtx", mtxLine(cut), true));
    EXPECT_TRUE(json["decoded"].is_null());
    EXPECT_EQ(json["record_hex"], "10011a057374");
    EXPECT_EQ(json["decode_error"], "record does not decode as AudioIssueDetected");

    const std::string notBase64 = R"({"time":0,"metric":5963779,"record":"%%%"})";
    EXPECT_EQ(QVReportingCtlFormatSinkLine("mtx", notBase64, false),
              "1970-01-01T00:00:00.000Z mtx {\"metric\":5963779,\"record\":\"%%%\"} record is not "
              "base64");
    json = Json::parse(QVReportingCtlFormatSinkLine("mtx", R"({"metric":1})", true));
    EXPECT_TRUE(json["decoded"].is_null());
    EXPECT_EQ(json["decode_error"], "record is not base64");
}

}  // namespace
}  // namespace qv::client
