#include "platform/linux/LinuxProcessInfo.h"

#include <gtest/gtest.h>

#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "fakes/TempDirectory.h"

namespace qv {
namespace {

namespace fs = std::filesystem;

TEST(ALinuxProcessInfo, ReadsTheCommandNameWithoutItsLineFeed) {
    const test::TempDirectory tmp{"qvproc"};
    const fs::path& root = tmp.path();
    fs::create_directories(root / "42");
    std::ofstream(root / "42" / "comm") << "coreaudiod\n";
    fs::create_directories(root / "43");
    std::ofstream(root / "43" / "comm") << "no-line-feed";

    LinuxProcessInfo info(root.string());
    EXPECT_EQ(info.processName(42), "coreaudiod");
    EXPECT_EQ(info.processName(43), "no-line-feed");
    EXPECT_FALSE(info.processName(44));
    EXPECT_FALSE(info.processName(0));
    EXPECT_FALSE(info.processName(-42));
}

TEST(ALinuxProcessInfo, KnowsItsOwnProcessOnTheRealProcFileSystem) {
    LinuxProcessInfo info;
    EXPECT_EQ(info.ownProcessIdentifier(), static_cast<std::int64_t>(::getpid()));
    const auto own = info.processName(info.ownProcessIdentifier());
    ASSERT_TRUE(own);
    EXPECT_EQ(*own, "qv_unit_tests");
    EXPECT_FALSE(info.processName(std::int64_t{1} << 40));
}

}  // namespace
}  // namespace qv
