#include "QVReportingCtlSupport.h"

#include <filesystem>
#include <fstream>
#include <string>

#include <gtest/gtest.h>

#include "fakes/TempDirectory.h"

namespace qv::client {
namespace {

TEST(TheCtlVocabulary, ReadsNumbersAtTheirLimitsAndOnlyNamesThatStandForOneValue) {
    using U = std::optional<std::uint32_t>;
    const std::pair<const char*, U> categories[] = {{"0x10000008", 0x10000008u},
                                                    {"4294967295", 0xFFFFFFFFu},
                                                    {"4294967296", {}},
                                                    {"Toolbox_Output", 0x80000005u},
                                                    {"Unknown", 0xFFFFFFFFu},
                                                    {"Undefined", {}},
                                                    {"_Setup", {}},
                                                    {"playback", {}},
                                                    {" 4", {}},
                                                    {"+4", {}},
                                                    {"-1", {}},
                                                    {"0x", {}},
                                                    {"", {}}};
    for (const auto& [text, value] : categories) {
        EXPECT_EQ(QVReportingCtlParseCategory(text), value) << '"' << text << '"';
    }
    EXPECT_EQ(QVReportingCtlParseType("65535"), 65535);
    EXPECT_EQ(QVReportingCtlParseType("65536"), std::nullopt);
    EXPECT_EQ(QVReportingCtlParseType("Listeningenhancement"), 14);
    EXPECT_EQ(QVReportingCtlParseServiceType("Telephony"), std::nullopt);
    EXPECT_EQ(QVReportingCtlParseCategoryFromJson(nlohmann::ordered_json(-1)), std::nullopt);
    EXPECT_EQ(QVReportingCtlParseServiceTypeFromJson(nlohmann::ordered_json(1.5)), std::nullopt);
    EXPECT_EQ(QVReportingCtlParseUnsigned("0xFFFFFFFFFFFFFFFF"), UINT64_MAX);
    EXPECT_EQ(QVReportingCtlParseUnsigned("18446744073709551616"), std::nullopt);
    EXPECT_EQ(QVReportingCtlParseReporterID("-9223372036854775808"), INT64_MIN);
    EXPECT_EQ(QVReportingCtlParseReporterID("9223372036854775808"), std::nullopt);
    EXPECT_EQ(QVReportingCtlParseReporterID("5x"), std::nullopt);
}

TEST(ASinkList, NamesEachSinkOnceWhateverSegmentsItHas) {
    const test::TempDirectory tmp("qvsinklist");
    const std::string dir = tmp.path().string();
    std::filesystem::create_directories(dir + "/sinks");
    for (const char* name : {"analytics.jsonl", "analytics.000000000001.jsonl",
                             "mtx.000000000007.jsonl", ".hidden.jsonl", "notes.txt"}) {
        std::ofstream(dir + "/sinks/" + name) << "";
    }
    EXPECT_EQ(QVReportingCtlListSinks(dir), (std::vector<std::string>{"analytics", "mtx"}));
}

}  // namespace
}  // namespace qv::client
