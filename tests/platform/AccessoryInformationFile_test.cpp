#include "platform/linux/bluetooth/AccessoryInformationFile.h"

#include <gtest/gtest.h>

#include <fstream>
#include <string>

#include "fakes/TempDirectory.h"

namespace qv {
namespace {

constexpr const char* kAddress = "AA:BB:CC:DD:EE:0F";

void write(const std::filesystem::path& path, const std::string& text) {
    std::ofstream(path, std::ios::binary) << text;
}

TEST(ABluetoothAddress, IsSixHexPairsAndComesOutInUpperCase) {
    EXPECT_EQ(QVReportingCanonicalBluetoothAddress("aa:bb:cc:dd:ee:0f"), "AA:BB:CC:DD:EE:0F");
    EXPECT_EQ(QVReportingCanonicalBluetoothAddress("00:11:22:33:44:55"), "00:11:22:33:44:55");
    for (const char* bad :
         {"", "AA:BB:CC:DD:EE", "AA:BB:CC:DD:EE:0F:", "AA-BB-CC-DD-EE-0F", "AA:BB:CC:DD:EE:0G",
          "../../etc/pa", "AA:BB:CC:DD:E/:0F", "AA:BB:CC:DD:EE:\n0", " A:BB:CC:DD:EE:0F"}) {
        EXPECT_EQ(QVReportingCanonicalBluetoothAddress(bad), std::nullopt) << bad;
    }
}

TEST(AnAccessoryFile, LoadsAWellFormedFileAndRefusesEverythingElseWithAReason) {
    test::TempDirectory dir("qvaccessory");
    const auto path = dir / (std::string(kAddress) + ".json");
    const std::string dirName = dir.path().string();

    EXPECT_EQ(QVReportingReadAccessoryFile(dirName, kAddress).status,
              AccessoryFileResult::Status::Missing);

    write(path, R"({"TELPVersionInfo": ["a", "M4801", 3], "CaseInfo": {"CaseInfoVersion": "1"}})");
    auto loaded = QVReportingReadAccessoryFile(dirName, kAddress);
    ASSERT_EQ(loaded.status, AccessoryFileResult::Status::Loaded);
    EXPECT_EQ(loaded.information, (Dictionary{{"TELPVersionInfo", Array{"a", "M4801", 3}},
                                              {"CaseInfo", Dictionary{{"CaseInfoVersion", "1"}}}}));

    const std::string deep = std::string(9, '[') + std::string(9, ']');
    const std::pair<std::string, std::string> refusals[] = {
        {"{\"TELPVersionInfo\": [", "it is not JSON"},
        {"[1, 2]", "it is not a JSON object"},
        {R"({"CaseInfo": {}})", "it has no \"TELPVersionInfo\""},
        {R"({"TELPVersionInfo": "M4801", "CaseInfo": {}})",
         "its \"TELPVersionInfo\" is not a list"},
        {R"({"TELPVersionInfo": []})", "it has no \"CaseInfo\""},
        {R"({"TELPVersionInfo": [], "CaseInfo": [1]})", "its \"CaseInfo\" is not an object"},
        {"{\"TELPVersionInfo\": [\"\xff\"], \"CaseInfo\": {}}", "it is not JSON"},
        {std::string(R"({"TELPVersionInfo": [], "CaseInfo": {}})") + '\0' + "x", "it is not JSON"},
        {R"({"TELPVersionInfo": [)" + deep + R"(], "CaseInfo": {}})", "nested deeper than 8"},
        {R"({"TELPVersionInfo": [], "CaseInfo": {}, "pad": ")" +
             std::string(kMaxAccessoryFileBytes, 'x') + "\"}",
         "more than the 65536 accepted"},
    };
    for (const auto& [text, reason] : refusals) {
        write(path, text);
        const auto r = QVReportingReadAccessoryFile(dirName, kAddress);
        EXPECT_EQ(r.status, AccessoryFileResult::Status::Refused) << reason;
        EXPECT_NE(r.reason.find(reason), std::string::npos) << r.reason;
    }
}

}  // namespace
}  // namespace qv
