#include "platform/linux/system/LinuxDeviceInformation.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <functional>
#include <optional>
#include <string>

#include "fakes/TempDirectory.h"

namespace qv {
namespace {

namespace fs = std::filesystem;

class ALinuxDeviceInformation : public ::testing::Test {
  protected:
    std::string write(const std::string& text) {
        const fs::path path = dir / "device.json";
        std::ofstream(path, std::ios::binary) << text;
        return path.string();
    }

    test::TempDirectory tmp{"qvdevice"};
    const fs::path dir = tmp.path();
};

// Which files are used and what they answer is the device_file fuzz target's; here, what it
// cannot make: no file, a link and a file past the limit.
TEST_F(ALinuxDeviceInformation, TakesNoFileAsACustomerBuildAndRefusesALinkAndAFilePastItsLimit) {
    // A missing file is a customer build without capabilities, and no error; the override wins.
    LinuxDeviceInformation missing((dir / "none.json").string(), dir, true);
    EXPECT_EQ(missing.loadError(), "");
    EXPECT_EQ(missing.boolAnswer("InternalBuild"), true);
    EXPECT_FALSE(missing.hasCapability("haptics"));

    // A valid device file of exactly `bytes` bytes.
    const auto padded = [](std::size_t bytes) {
        const std::string head = R"({"InternalBuild": true, "pad": ")";
        return head + std::string(bytes - head.size() - 2, ' ') + "\"}";
    };
    const std::string valid = write(R"({"InternalBuild": true})");
    const struct {
        std::string path;
        std::function<void(const fs::path&)> make;
        const char* cause;
    } cases[] = {
        {(dir / "link").string(), [&](const fs::path& p) { fs::create_symlink(valid, p); },
         "it is a symbolic link"},
        {(dir / "large").string(),
         [&](const fs::path& p) {
             std::ofstream(p) << padded(LinuxDeviceInformation::kMaxDeviceFileBytes + 1);
         },
         "more than the 1048576 accepted"},
    };
    for (const auto& c : cases) {
        c.make(c.path);
        const LinuxDeviceInformation device(c.path, dir, std::nullopt);
        EXPECT_EQ(device.loadError().find(c.path), 0u) << device.loadError();
        EXPECT_NE(device.loadError().find(c.cause), std::string::npos) << device.loadError();
        EXPECT_TRUE(device.fileRefused()) << c.path;
        EXPECT_EQ(device.boolAnswer("InternalBuild"), std::nullopt) << c.path;
    }
    EXPECT_FALSE(LinuxDeviceInformation(valid, dir, std::nullopt).fileRefused());
    // The limit itself is accepted.
    const LinuxDeviceInformation atLimit(write(padded(LinuxDeviceInformation::kMaxDeviceFileBytes)),
                                         dir, std::nullopt);
    EXPECT_EQ(atLimit.loadError(), "");
    EXPECT_EQ(atLimit.boolAnswer("InternalBuild"), true);
}

}  // namespace
}  // namespace qv
