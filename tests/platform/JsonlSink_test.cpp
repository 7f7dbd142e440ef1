#include "platform/linux/JsonlSink.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <limits>
#include <mutex>
#include <nlohmann/json.hpp>
#include <string>
#include <thread>
#include <vector>

#include "fakes/FakeClock.h"
#include "fakes/TempDirectory.h"

namespace qv {
namespace {

namespace fs = std::filesystem;
using nlohmann::ordered_json;

class AJsonlSink : public ::testing::Test {
  protected:
    void SetUp() override { stateDir = root / "state"; }

    SinkCallbacks recording() {
        return {[this](std::string_view sink) {
                    std::lock_guard lock(mutex);
                    lost.emplace_back(sink);
                },
                [this](const std::string& message) {
                    std::lock_guard lock(mutex);
                    problems.push_back(message);
                }};
    }
    std::size_t lostCount() {
        std::lock_guard lock(mutex);
        return lost.size();
    }
    std::vector<std::string> problemsSoFar() {
        std::lock_guard lock(mutex);
        return problems;
    }

    static std::vector<std::string> readLines(const fs::path& path) {
        std::ifstream in(path, std::ios::binary);
        std::vector<std::string> lines;
        for (std::string line; std::getline(in, line);) {
            lines.push_back(line);
        }
        return lines;
    }
    static std::vector<std::string> keysOf(const ordered_json& object) {
        std::vector<std::string> keys;
        for (const auto& item : object.items()) {
            keys.push_back(item.key());
        }
        return keys;
    }

    test::TempDirectory tmp{"qvsink"};
    const fs::path root = tmp.path();
    fs::path stateDir;
    test::FakeClock clock;
    std::mutex mutex;
    std::vector<std::string> lost;      // guarded by mutex
    std::vector<std::string> problems;  // guarded by mutex
};

TEST_F(AJsonlSink, WritesOneObjectPerLineWithTheTimeFirstAndEveryValueExact) {
    const std::uint64_t bigUnsigned = std::numeric_limits<std::uint64_t>::max();
    const std::int64_t smallest = std::numeric_limits<std::int64_t>::min();
    const double third = 0.1 + 0.2;  // 0.30000000000000004: needs all 17 digits
    const double startTime = clock.now() + 0.125;
    clock.setNow(startTime);
    {
        JsonlSink sink(stateDir.string(), "analytics", clock, recording());
        EXPECT_EQ(sink.path(), (stateDir / "sinks" / "analytics.jsonl").string());
        EXPECT_TRUE(sink.append({{"zeta", bigUnsigned},
                                 {"alpha", smallest},
                                 {"third", third},
                                 {"tiny", 5e-324},
                                 {"bytes", Bytes{0x00, 0x01, 0x02, 0xFF}},
                                 {"when", Date{1706707501.25}},
                                 {"nested", Dictionary{{"b", 1}, {"a", 2}}},
                                 {"text", "two\nlines \"quoted\""}}));
        clock.advance(1.5);
        EXPECT_TRUE(sink.append({{"n", 2}}));
        sink.flush();
        // After flush the lines are in the file, whether or not the sink is still open.
        EXPECT_EQ(readLines(sink.path()).size(), 2u);
    }
    {
        // Another sink on the same file appends, and when destroyed without a flush it still
        // writes every line it queued.
        JsonlSink again(stateDir.string(), "analytics", clock, recording());
        for (int i = 0; i < 50; ++i) {
            again.append({{"i", i}});
        }
    }
    const auto lines = readLines(stateDir / "sinks" / "analytics.jsonl");
    ASSERT_EQ(lines.size(), 52u);
    for (int i = 0; i < 50; ++i) {
        EXPECT_EQ(ordered_json::parse(lines[i + 2])["i"], i);
    }

    const auto first = ordered_json::parse(lines[0]);
    EXPECT_EQ(keysOf(first), (std::vector<std::string>{"time", "zeta", "alpha", "third", "tiny",
                                                       "bytes", "when", "nested", "text"}));
    EXPECT_TRUE(first["time"].is_number_float());
    EXPECT_EQ(first["time"].get<double>(), startTime);
    EXPECT_TRUE(first["zeta"].is_number_unsigned());
    EXPECT_EQ(first["zeta"].get<std::uint64_t>(), bigUnsigned);
    EXPECT_EQ(first["alpha"].get<std::int64_t>(), smallest);
    EXPECT_EQ(first["third"].get<double>(), third);
    EXPECT_EQ(first["tiny"].get<double>(), 5e-324);
    EXPECT_EQ(first["bytes"], "AAEC/w==");
    EXPECT_EQ(first["when"].get<double>(), 1706707501.25);
    EXPECT_EQ(keysOf(first["nested"]), (std::vector<std::string>{"b", "a"}));
    EXPECT_EQ(first["text"], "two\nlines \"quoted\"");

    const auto second = ordered_json::parse(lines[1]);
    EXPECT_EQ(second["time"].get<double>(), startTime + 1.5);
    EXPECT_EQ(second["n"], 2);
    EXPECT_EQ(lostCount(), 0u);
    EXPECT_TRUE(problemsSoFar().empty());
}

TEST_F(AJsonlSink, DropsAndCountsLinesWhenItsBufferIsFull) {
    // A FIFO with no reader holds the sink's thread in open(), so nothing drains the buffer
    // until the test opens the reading end.
    const fs::path path = stateDir / "sinks" / "busy.jsonl";
    fs::create_directories(path.parent_path());
    ASSERT_EQ(::mkfifo(path.c_str(), 0600), 0);
    int reader = -1;
    std::vector<std::string> received;
    int refused = 0;
    {
        JsonlSink sink(stateDir.string(), "busy", clock, recording(), /*capacity=*/2);
        // At most one line in the thread's hands and two in the buffer: of five, two or more drop.
        for (int i = 0; i < 5; ++i) {
            refused += sink.append({{"n", i}}) ? 0 : 1;
        }
        reader = ::open(path.c_str(), O_RDONLY | O_NONBLOCK);  // releases the sink's thread
        sink.flush();
        EXPECT_TRUE(sink.append({{"n", 5}}));  // room again once the buffer drains
        sink.flush();
        std::string text;
        char buffer[4096];
        for (ssize_t n; (n = ::read(reader, buffer, sizeof buffer)) > 0;) {
            text.append(buffer, static_cast<std::size_t>(n));
        }
        for (std::size_t start = 0, end; (end = text.find('\n', start)) != std::string::npos;
             start = end + 1) {
            received.push_back(text.substr(start, end - start));
        }
    }  // the sink closes its end before the reader goes, so no write meets a closed pipe
    ASSERT_GE(reader, 0);
    ::close(reader);

    EXPECT_GE(refused, 2);
    EXPECT_EQ(lostCount(), static_cast<std::size_t>(refused));
    EXPECT_EQ(received.size() + static_cast<std::size_t>(refused), 6u);
    int previous = -1;
    for (const auto& line : received) {
        const int n = ordered_json::parse(line)["n"].get<int>();
        EXPECT_GT(n, previous) << "lines kept their order";
        previous = n;
    }
    EXPECT_EQ(previous, 5);
    std::lock_guard lock(mutex);
    for (const auto& name : lost) {
        EXPECT_EQ(name, "busy");
    }
    ASSERT_FALSE(problems.empty());
    EXPECT_NE(problems[0].find("full"), std::string::npos);
}

TEST_F(AJsonlSink, ReportsAndCountsLinesItCannotWriteAndGoesOn) {
    // The state directory is a plain file, so the sink directory can never be made (this holds
    // for root too, which ignores permissions).
    std::ofstream(root / "plain") << "not a directory";
    {
        JsonlSink sink((root / "plain").string(), "analytics", clock, recording());
        for (int i = 0; i < 3; ++i) {
            EXPECT_TRUE(sink.append({{"i", i}}));  // queued; lost only when written
        }
        sink.flush();
    }
    EXPECT_EQ(lostCount(), 3u);
    auto reported = problemsSoFar();
    ASSERT_EQ(reported.size(), 1u) << "the same cause is reported once, not once per line";
    EXPECT_NE(reported[0].find("analytics"), std::string::npos);
    EXPECT_NE(reported[0].find("cannot create"), std::string::npos);

    // A write that fails (the file is the full device) is lost; once the file is fixed the next
    // line opens it afresh and is written.
    const fs::path path = stateDir / "sinks" / "energylog.jsonl";
    fs::create_directories(path.parent_path());
    fs::create_symlink("/dev/full", path);
    JsonlSink sink(stateDir.string(), "energylog", clock, recording());
    sink.append({{"i", 0}});
    sink.flush();
    EXPECT_EQ(lostCount(), 4u);
    reported = problemsSoFar();
    ASSERT_EQ(reported.size(), 2u);
    EXPECT_NE(reported[1].find("energylog"), std::string::npos);
    EXPECT_NE(reported[1].find("cannot write"), std::string::npos);

    fs::remove(path);
    sink.append({{"i", 1}});
    sink.flush();
    EXPECT_EQ(lostCount(), 4u);
    const auto lines = readLines(path);
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(ordered_json::parse(lines[0])["i"], 1);
    reported = problemsSoFar();
    ASSERT_EQ(reported.size(), 3u);
    EXPECT_NE(reported[2].find("again"), std::string::npos);
}

TEST_F(AJsonlSink, KeepsEveryLineWholeWhenManyThreadsAppendAtOnce) {
    constexpr int kThreads = 4;
    constexpr int kLinesEach = 200;
    const std::string padding(300, 'x');  // long lines make interleaved writes visible
    {
        JsonlSink sink(stateDir.string(), "convo", clock, recording(), kThreads * kLinesEach);
        std::vector<std::thread> threads;
        for (int t = 0; t < kThreads; ++t) {
            threads.emplace_back([&, t] {
                for (int i = 0; i < kLinesEach; ++i) {
                    sink.append({{"thread", t}, {"i", i}, {"pad", padding}});
                }
            });
        }
        for (auto& thread : threads) {
            thread.join();
        }
        sink.flush();
    }
    const auto lines = readLines(stateDir / "sinks" / "convo.jsonl");
    ASSERT_EQ(lines.size(), static_cast<std::size_t>(kThreads * kLinesEach));
    std::vector<int> next(kThreads, 0);
    for (const auto& line : lines) {
        const auto object = ordered_json::parse(line);
        const int t = object["thread"].get<int>();
        ASSERT_TRUE(t >= 0 && t < kThreads);
        EXPECT_EQ(object["i"].get<int>(), next[t]) << "each thread's lines stay in order";
        ++next[t];
    }
    EXPECT_EQ(lostCount(), 0u);
}

}  // namespace
}  // namespace qv
