#include "platform/linux/LinuxDeviceInformation.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <optional>
#include <string>

namespace qv {
namespace {

namespace fs = std::filesystem;

class ALinuxDeviceInformation : public ::testing::Test {
  protected:
    void SetUp() override {
        dir = fs::temp_directory_path() /
              ("qv-device-" + std::to_string(::testing::UnitTest::GetInstance()->random_seed()) +
               "-" + ::testing::UnitTest::GetInstance()->current_test_info()->name());
        fs::create_directories(dir);
    }
    void TearDown() override { fs::remove_all(dir); }

    std::string write(const std::string& text) {
        const fs::path path = dir / "device.json";
        std::ofstream(path, std::ios::binary) << text;
        return path.string();
    }

    fs::path dir;
};

TEST_F(ALinuxDeviceInformation, UsesAnObjectAndRefusesEverythingElseNamingTheFile) {
    LinuxDeviceInformation device(
        write(R"({"InternalBuild": true, "capabilities": {"haptics": true, "x": 1}})"), dir,
        std::nullopt);
    EXPECT_EQ(device.loadError(), "");
    EXPECT_EQ(device.boolAnswer("InternalBuild"), true);
    EXPECT_TRUE(device.hasCapability("haptics"));
    EXPECT_FALSE(device.hasCapability("x"));

    // Text after a NUL byte would go unread by the parser: the file is not JSON.
    for (const std::string& text : {std::string("[true]"), std::string("{\"InternalBuild\": tru"),
                                    std::string(R"({"InternalBuild": true})") + '\0' + "{"}) {
        const std::string path = write(text);
        LinuxDeviceInformation refused(path, dir, std::nullopt);
        EXPECT_NE(refused.loadError().find(path), std::string::npos) << text;
        EXPECT_EQ(refused.boolAnswer("InternalBuild"), std::nullopt) << text;
    }

    // A missing file is a customer build without capabilities, and no error; the override wins.
    LinuxDeviceInformation missing((dir / "none.json").string(), dir, true);
    EXPECT_EQ(missing.loadError(), "");
    EXPECT_EQ(missing.boolAnswer("InternalBuild"), true);
    EXPECT_FALSE(missing.hasCapability("haptics"));
}

}  // namespace
}  // namespace qv
