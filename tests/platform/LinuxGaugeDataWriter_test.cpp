#include "platform/linux/trace/LinuxGaugeDataWriter.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <cerrno>
#include <cmath>
#include <fstream>
#include <limits>

#include "fakes/TempDirectory.h"

namespace qv {
namespace {

namespace fs = std::filesystem;

nlohmann::json readJson(const fs::path& path) {
    std::ifstream in(path);
    return nlohmann::json::parse(in);
}

TEST(ALinuxGaugeDataWriter, WritesOneJsonValuePerMeasurementAcrossItsChunks) {
    test::TempDirectory dir("qvgauge");
    LinuxGaugeDataWriter writer;

    auto empty = writer.open(dir / "empty.gdj", "QVReporting", 4, 0);
    ASSERT_TRUE(empty.file);
    EXPECT_EQ(empty.file->close(), 0);
    EXPECT_EQ(readJson(dir / "empty.gdj"),
              nlohmann::json::parse(R"({"name":"QVReporting","version":4,"values":[]})"));

    auto opened = writer.open(dir / "r.gdj", "QVReporting", 4, 0);
    ASSERT_TRUE(opened.file);
    opened.file->addValue("decode", "milliseconds", 0.1 + 0.2);
    opened.file->addValue("bad\xff\"name", "milliseconds", std::nan(""));
    opened.file->addValue("huge", "milliseconds", std::numeric_limits<double>::infinity());
    const int many = 20000;  // several chunks' worth
    for (int i = 0; i < many; ++i) {
        opened.file->addValue("mix", "milliseconds", i);
    }
    EXPECT_EQ(opened.file->close(), 0);
    auto json = readJson(dir / "r.gdj");
    const auto values = json["values"];
    ASSERT_EQ(values.size(), 3u + many);
    EXPECT_EQ(values[3 + many - 1]["value"], many - 1);
    // Every digit kept, bad bytes replaced, what is not a number written as null.
    json["values"] = {values[0], values[1], values[2]};
    EXPECT_EQ(json, nlohmann::json::parse(R"({"name":"QVReporting","version":4,"values":[
        {"name":"decode","unit":"milliseconds","value":0.30000000000000004},
        {"name":"bad\uFFFD\"name","unit":"milliseconds","value":null},
        {"name":"huge","unit":"milliseconds","value":null}]})"));
}

TEST(ALinuxGaugeDataWriter, RefusesOptionsLinksAndMissingDirectoriesWithTheirErrorNumbers) {
    test::TempDirectory dir("qvgauge");
    LinuxGaugeDataWriter writer;
    EXPECT_EQ(writer.open(dir / "a.gdj", "QVReporting", 4, 1).error, EINVAL);
    EXPECT_EQ(writer.open(dir / "missing/a.gdj", "QVReporting", 4, 0).error, ENOENT);
    fs::create_symlink(dir / "target", dir / "link.gdj");
    const auto linked = writer.open(dir / "link.gdj", "QVReporting", 4, 0);
    EXPECT_FALSE(linked.file);
    EXPECT_EQ(linked.error, ELOOP);
    EXPECT_FALSE(fs::exists(dir / "target"));
}

}  // namespace
}  // namespace qv
