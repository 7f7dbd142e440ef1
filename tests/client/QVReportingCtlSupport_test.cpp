#include "QVReportingCtlSupport.h"

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <string>

#include <gtest/gtest.h>

namespace qv::client {
namespace {

TEST(TheCtlVocabulary, ReadsCategoriesAsNumbersOrPrintedNames) {
    EXPECT_EQ(QVReportingCtlParseCategory("4"), 4u);
    EXPECT_EQ(QVReportingCtlParseCategory("0x10000008"), 0x10000008u);
    EXPECT_EQ(QVReportingCtlParseCategory("4294967295"), 0xFFFFFFFFu);
    EXPECT_EQ(QVReportingCtlParseCategory("4294967296"), std::nullopt);
    EXPECT_EQ(QVReportingCtlParseCategory("Playback"), 4u);
    EXPECT_EQ(QVReportingCtlParseCategory("Toolbox_Output"), 0x80000005u);
    EXPECT_EQ(QVReportingCtlParseCategory("Earlink"), 17u);
    EXPECT_EQ(QVReportingCtlParseCategory("Unknown"), 0xFFFFFFFFu);
    // Names that stand for many values, or none, are refused.
    EXPECT_EQ(QVReportingCtlParseCategory("Undefined"), std::nullopt);
    EXPECT_EQ(QVReportingCtlParseCategory("_Setup"), std::nullopt);
    EXPECT_EQ(QVReportingCtlParseCategory("playback"), std::nullopt);
    for (const char* bad : {"", " 4", "+4", "-1", "4x", "0x", "0x1FFFFFFFF"}) {
        EXPECT_EQ(QVReportingCtlParseCategory(bad), std::nullopt) << '"' << bad << '"';
    }
}

TEST(TheCtlVocabulary, ReadsTypesServiceTypesAndReporterIDs) {
    EXPECT_EQ(QVReportingCtlParseType("Generic"), 0);
    EXPECT_EQ(QVReportingCtlParseType("MemoryLog"), 19);
    EXPECT_EQ(QVReportingCtlParseType("Unknown"), 65535);
    EXPECT_EQ(QVReportingCtlParseType("65535"), 65535);
    EXPECT_EQ(QVReportingCtlParseType("65536"), std::nullopt);
    EXPECT_EQ(QVReportingCtlParseType("Listeningenhancement"), 14);

    EXPECT_EQ(QVReportingCtlParseServiceType("telephony"), 2);
    EXPECT_EQ(QVReportingCtlParseServiceType("unknown"), 65535);
    EXPECT_EQ(QVReportingCtlParseServiceType("Telephony"), std::nullopt);

    EXPECT_EQ(QVReportingCtlParseCategoryFromJson(nlohmann::ordered_json(-1)), std::nullopt);
    EXPECT_EQ(QVReportingCtlParseTypeFromJson(nlohmann::ordered_json("Stop")), 2);
    EXPECT_EQ(QVReportingCtlParseServiceTypeFromJson(nlohmann::ordered_json(1.5)), std::nullopt);

    EXPECT_EQ(QVReportingCtlParseUnsigned("18446744073709551615"), UINT64_MAX);
    EXPECT_EQ(QVReportingCtlParseUnsigned("0xFFFFFFFFFFFFFFFF"), UINT64_MAX);
    EXPECT_EQ(QVReportingCtlParseUnsigned("18446744073709551616"), std::nullopt);
    EXPECT_EQ(QVReportingCtlParseUnsigned("-1"), std::nullopt);

    EXPECT_EQ(QVReportingCtlParseReporterID("-9223372036854775808"), INT64_MIN);
    EXPECT_EQ(QVReportingCtlParseReporterID("9223372036854775807"), INT64_MAX);
    EXPECT_EQ(QVReportingCtlParseReporterID("9223372036854775808"), std::nullopt);
    EXPECT_EQ(QVReportingCtlParseReporterID("5x"), std::nullopt);
    EXPECT_EQ(QVReportingCtlParseReporterID(""), std::nullopt);
}

TEST(TheCtlStateDirectory, FollowsTheDaemonsOrderOfChoices) {
    std::map<std::string, std::string> env;
    const auto lookup = [&](const char* name) -> const char* {
        auto it = env.find(name);
        return it == env.end() ? nullptr : it->second.c_str();
    };
    env = {{"STATE_DIRECTORY", "/var/lib/a:/var/lib/b"}, {"HOME", "/home/u"}};
    EXPECT_EQ(QVReportingCtlDefaultStateDirectory(lookup, 0), "/var/lib/a");
    env = {{"STATE_DIRECTORY", ""}, {"XDG_STATE_HOME", "/x"}, {"HOME", "/home/u"}};
    EXPECT_EQ(QVReportingCtlDefaultStateDirectory(lookup, 0), "/var/lib/qvreportd");
    EXPECT_EQ(QVReportingCtlDefaultStateDirectory(lookup, 1000), "/x/qvreportd");
    env = {{"HOME", "/home/u"}};
    EXPECT_EQ(QVReportingCtlDefaultStateDirectory(lookup, 1000), "/home/u/.local/state/qvreportd");
    env = {};
    EXPECT_EQ(QVReportingCtlDefaultStateDirectory(lookup, 1000), "/tmp/.local/state/qvreportd");
}

TEST(ASinkLineFormatter, ShowsTimesInUTCAndRoundsMillisecondsDown) {
    EXPECT_EQ(QVReportingCtlFormatUTC(0), "1970-01-01T00:00:00.000Z");
    EXPECT_EQ(QVReportingCtlFormatUTC(1.9999), "1970-01-01T00:00:01.999Z");
    EXPECT_EQ(QVReportingCtlFormatUTC(-0.5), "1969-12-31T23:59:59.500Z");
    EXPECT_EQ(QVReportingCtlFormatUTC(1714566645.25), "2024-05-01T12:30:45.250Z");
}

TEST(ASinkLineFormatter, DecodesMTXRecordsAndKeepsOtherLinesAsTheyAre) {
    const std::string mtx = R"({"time":0.5,"metric":"AudioIssueDetected","record":"CAH/"})";
    EXPECT_EQ(
        QVReportingCtlFormatSinkLine("mtx", mtx, false),
        R"(1970-01-01T00:00:00.500Z mtx {"metric":"AudioIssueDetected","record_hex":"0801ff"})");
    EXPECT_EQ(
        QVReportingCtlFormatSinkLine("mtx", mtx, true),
        R"({"sink":"mtx","time":0.5,"metric":"AudioIssueDetected","record":"CAH/","record_hex":"0801ff"})");
    // Only the mtx sink's records are metric bytes; bad base64 is shown untouched.
    EXPECT_EQ(QVReportingCtlFormatSinkLine("analytics", R"({"time":0,"record":"CAH/"})", false),
              R"(1970-01-01T00:00:00.000Z analytics {"record":"CAH/"})");
    EXPECT_EQ(QVReportingCtlFormatSinkLine("mtx", R"({"time":0,"record":"CAH"})", false),
              R"(1970-01-01T00:00:00.000Z mtx {"record":"CAH"})");
    EXPECT_EQ(QVReportingCtlFormatSinkLine("convo", "{\"time\":0,\"op\"", false),
              "(unreadable) convo {\"time\":0,\"op\"");
    EXPECT_EQ(QVReportingCtlFormatSinkLine("convo", "[1]", true),
              R"({"sink":"convo","unreadable":"[1]"})");
}

class ASinkTail : public ::testing::Test {
  protected:
    void SetUp() override {
        char pattern[] = "/tmp/qvsinktail.XXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir_ = pattern;
        path_ = dir_ + "/sinks/analytics.jsonl";
        std::filesystem::create_directories(dir_ + "/sinks");
    }
    void TearDown() override { std::filesystem::remove_all(dir_); }

    void append(const std::string& text) {
        std::ofstream(path_, std::ios::app | std::ios::binary) << text;
    }

    std::string dir_;
    std::string path_;
};

TEST_F(ASinkTail, HoldsBackALineUntilItsNewlineArrives) {
    QVReportingSinkTail tail(path_);
    EXPECT_TRUE(tail.readNewLines().empty());  // no file yet

    append("{\"a\":1}\n{\"b\":");
    EXPECT_EQ(tail.readNewLines(), std::vector<std::string>{"{\"a\":1}"});
    EXPECT_TRUE(tail.readNewLines().empty());
    append("2}\n\n");
    EXPECT_EQ(tail.readNewLines(), (std::vector<std::string>{"{\"b\":2}", ""}));
}

TEST_F(ASinkTail, StartsOverWhenTheFileIsTruncatedOrReplaced) {
    QVReportingSinkTail tail(path_);
    append("one\ntwo\n");
    EXPECT_EQ(tail.readNewLines().size(), 2u);

    std::ofstream(path_, std::ios::trunc) << "x\n";
    EXPECT_EQ(tail.readNewLines(), std::vector<std::string>{"x"});

    // A new file of the same name, longer than what was read of the old one.
    const std::string other = dir_ + "/sinks/next";
    std::ofstream(other) << "first\nsecond\n";
    std::filesystem::rename(other, path_);
    EXPECT_EQ(tail.readNewLines(), (std::vector<std::string>{"first", "second"}));

    EXPECT_EQ(QVReportingCtlListSinks(dir_), std::vector<std::string>{"analytics"});
}

}  // namespace
}  // namespace qv::client
