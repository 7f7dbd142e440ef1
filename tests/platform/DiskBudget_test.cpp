#include "platform/linux/sinks/DiskBudget.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <string>
#include <vector>

#include "fakes/TempDirectory.h"
#include "platform/SinkSegments.h"

namespace qv {
namespace {

namespace fs = std::filesystem;

void makeFile(const fs::path& path, std::size_t bytes, time_t modified) {
    std::ofstream(path, std::ios::binary) << std::string(bytes, 'x');
    const timespec times[2] = {{modified, 0}, {modified, 0}};
    ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
}

TEST(ADiskBudget, RemovesTheOldestClosedSegmentsFirstKeepingEachSinksOrderAndCountsThem) {
    test::TempDirectory tmp{"qvbudget"};
    const fs::path sinks = tmp.path();
    // b.5 was modified before b.1 (a clock set back), yet a sink's segments go in seq order.
    const struct {
        std::uint64_t maxBytes;
        std::vector<std::string> left;
        std::map<std::string, std::uint64_t> expired;
    } cases[] = {
        {400,
         {"a.000000000001.jsonl", "a.000000000011.jsonl", "b.000000000001.jsonl",
          "b.000000000005.jsonl"},
         {}},
        {300,
         {"a.000000000011.jsonl", "b.000000000001.jsonl", "b.000000000005.jsonl"},
         {{"a", 100}}},
        {250, {"a.000000000011.jsonl", "b.000000000005.jsonl"}, {{"a", 100}, {"b", 100}}},
        {100, {"a.000000000011.jsonl"}, {{"a", 100}, {"b", 200}}},
        {0, {}, {{"a", 200}, {"b", 200}}},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.maxBytes);
        makeFile(sinks / "a.000000000001.jsonl", 100, 1000);
        makeFile(sinks / "a.000000000011.jsonl", 100, 3000);
        makeFile(sinks / "b.000000000001.jsonl", 100, 2000);
        makeFile(sinks / "b.000000000005.jsonl", 100, 500);
        makeFile(sinks / "a.jsonl", 5000, 100);  // current: never removed nor counted
        std::map<std::string, std::uint64_t> expired;
        std::vector<std::string> logged;
        DiskBudget budget("sinks", c.maxBytes, DiskBudget::closedSinkSegmentsIn(sinks),
                          {[&](std::string_view sink, std::uint64_t bytes) {
                               expired[std::string(sink)] += bytes;
                           },
                           [&](const std::string& line) { logged.push_back(line); }});
        budget.enforce();
        std::vector<std::string> left;
        for (const auto& sink : {"a", "b"}) {
            for (const auto& segment : QVReportingListSinkSegments(sinks, sink)) {
                if (!segment.current) {
                    left.push_back(segment.path.filename().string());
                }
            }
        }
        EXPECT_EQ(left, c.left);
        EXPECT_EQ(expired, c.expired);
        EXPECT_TRUE(fs::exists(sinks / "a.jsonl"));
        EXPECT_EQ(logged.size(), c.expired.empty() ? 0u : 1u);
        for (const auto& entry : fs::directory_iterator(sinks)) {
            fs::remove(entry.path());
        }
    }
}

}  // namespace
}  // namespace qv
