#include "platform/linux/JsonlSink.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <limits>
#include <mutex>
#include <nlohmann/json.hpp>
#include <sstream>
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
    SinkCallbacks recording() {
        return {[this](std::string_view sink) {
                    std::lock_guard lock(mutex);
                    lost.emplace_back(sink);
                },
                [this](std::string_view) { ++tornRemoved; },
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
    static std::vector<ordered_json> readLines(const fs::path& path) {
        std::ifstream in(path, std::ios::binary);
        std::vector<ordered_json> lines;
        for (std::string line; std::getline(in, line);) {
            lines.push_back(ordered_json::parse(line));
        }
        return lines;
    }

    test::TempDirectory tmp{"qvsink"};
    const fs::path stateDir = tmp.path() / "state";
    test::FakeClock clock;
    std::mutex mutex;
    std::vector<std::string> lost;      // guarded by mutex
    std::vector<std::string> problems;  // guarded by mutex
    std::atomic<int> tornRemoved{0};
};

TEST_F(AJsonlSink, WritesOneObjectPerLineWithTheTimeFirstAndEveryValueExact) {
    const double startTime = clock.now() + 0.125;
    clock.setNow(startTime);
    {
        JsonlSink sink(stateDir.string(), "analytics", clock, recording());
        EXPECT_EQ(sink.path(), (stateDir / "sinks" / "analytics.jsonl").string());
        EXPECT_TRUE(sink.append({{"zeta", std::numeric_limits<std::uint64_t>::max()},
                                 {"alpha", std::numeric_limits<std::int64_t>::min()},
                                 {"third", 0.1 + 0.2},
                                 {"bytes", Bytes{0x00, 0x01, 0x02, 0xFF}},
                                 {"nested", Dictionary{{"b", 1}, {"a", 2}}},
                                 {"text", "two\nlines \"quoted\""}}));
    }
    const auto lines = readLines(stateDir / "sinks" / "analytics.jsonl");
    ASSERT_EQ(lines.size(), 1u);
    auto first = lines[0];
    EXPECT_EQ(first.begin().key(), "time");
    EXPECT_EQ(first["time"].get<double>(), startTime);
    EXPECT_TRUE(first["zeta"].is_number_unsigned());
    first.erase("time");
    EXPECT_EQ(first, ordered_json::parse(R"({"zeta":18446744073709551615,
        "alpha":-9223372036854775808,"third":0.30000000000000004,"bytes":"AAEC/w==",
        "nested":{"b":1,"a":2},"text":"two\nlines \"quoted\""})"));
    EXPECT_TRUE(lost.empty());
    EXPECT_TRUE(problems.empty());
}

TEST_F(AJsonlSink, DropsAndCountsLinesWhenItsBufferIsFull) {
    // A FIFO without a reader holds the sink's thread in open() until the test opens it.
    const fs::path path = stateDir / "sinks" / "busy.jsonl";
    fs::create_directories(path.parent_path());
    ASSERT_EQ(::mkfifo(path.c_str(), 0600), 0);
    int reader = -1;
    std::string text;
    std::size_t refused = 0;
    {
        JsonlSink sink(stateDir.string(), "busy", clock, recording(), /*capacity=*/2);
        for (int i = 0; i < 5; ++i) {
            refused += sink.append({{"n", i}}) ? 0 : 1;
        }
        reader = ::open(path.c_str(), O_RDONLY | O_NONBLOCK);
        sink.flush();
        EXPECT_TRUE(sink.append({{"n", 5}})) << "room again once the buffer drains";
        sink.flush();
        char buffer[4096];
        for (ssize_t n; (n = ::read(reader, buffer, sizeof buffer)) > 0;) {
            text.append(buffer, static_cast<std::size_t>(n));
        }
    }  // the sink closes its end before the reader goes
    ASSERT_GE(reader, 0);
    ::close(reader);

    // At most a batch of two lines in the thread's hands and two in the buffer.
    EXPECT_GE(refused, 1u);
    EXPECT_EQ(lost, std::vector<std::string>(refused, "busy"));
    std::vector<int> received;
    std::istringstream stream(text);
    for (std::string line; std::getline(stream, line);) {
        received.push_back(ordered_json::parse(line)["n"].get<int>());
    }
    EXPECT_EQ(received.size() + refused, 6u);
    EXPECT_TRUE(std::is_sorted(received.begin(), received.end()));
    EXPECT_EQ(received.back(), 5);
    ASSERT_FALSE(problems.empty());
    EXPECT_NE(problems[0].find("full"), std::string::npos);
}

TEST_F(AJsonlSink, ReportsACauseOnceCountsLostLinesAndRecovers) {
    // A plain file where the state directory should be blocks the sink directory, even for root.
    std::ofstream(tmp / "plain") << "x";
    JsonlSink sink((tmp / "plain").string(), "analytics", clock, recording());
    for (int i = 0; i < 3; ++i) {
        EXPECT_TRUE(sink.append({{"i", i}}));  // queued; lost only when written
    }
    sink.flush();
    EXPECT_EQ(lostCount(), 3u);
    ASSERT_EQ(problemsSoFar().size(), 1u) << "once, not once per line";
    EXPECT_NE(problemsSoFar()[0].find("cannot create"), std::string::npos);

    fs::remove(tmp / "plain");
    sink.append({{"i", 3}});
    sink.flush();
    EXPECT_EQ(lostCount(), 3u);
    const auto lines = readLines(tmp / "plain/sinks/analytics.jsonl");
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0]["i"], 3);
    ASSERT_EQ(problemsSoFar().size(), 2u);
    EXPECT_NE(problemsSoFar()[1].find("again"), std::string::npos);
}

TEST_F(AJsonlSink, RemovesATornLastLineLeftByACrashBeforeItWrites) {
    const fs::path path = stateDir / "sinks" / "mtx.jsonl";
    fs::create_directories(path.parent_path());
    const std::string whole = "{\"time\":1,\"n\":1}\n{\"time\":2,\"n\":2}\n";
    const std::string torn(5000, 'x');  // longer than one block read back
    for (const std::string& before : {whole + "{\"time\":3,\"n\"", whole, torn}) {
        SCOPED_TRACE(before.size());
        std::ofstream(path, std::ios::binary | std::ios::trunc) << before;
        tornRemoved = 0;
        {
            JsonlSink sink(stateDir.string(), "mtx", clock, recording());
            sink.append({{"n", 9}});
        }
        const auto lines = readLines(path);  // every line parses
        const bool wasTorn = before.back() != '\n';
        EXPECT_EQ(tornRemoved, wasTorn ? 1 : 0);
        ASSERT_EQ(lines.size(), before == torn ? 1u : 3u);
        EXPECT_EQ(lines.back()["n"], 9);
    }
}

TEST_F(AJsonlSink, LosesOnlyWhatAFullDiskRefusesAndKeepsLaterLinesWhole) {
    // A file size limit plays the full disk: writes past it fail (SIGXFSZ ignored: EFBIG).
    const auto previous = ::signal(SIGXFSZ, SIG_IGN);
    rlimit saved{};
    ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &saved), 0);
    const std::string padding(100, 'p');
    std::size_t lostWhileFull = 0;
    {
        JsonlSink sink(stateDir.string(), "energylog", clock, recording());
        rlimit small = saved;
        small.rlim_cur = 1000;
        ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &small), 0);
        for (int i = 0; i < 20; ++i) {
            sink.append({{"i", i}, {"pad", padding}});
        }
        sink.flush();
        ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &saved), 0);
        lostWhileFull = lostCount();
        sink.append({{"i", 20}});
    }
    ::signal(SIGXFSZ, previous);
    EXPECT_GT(lostWhileFull, 0u);
    EXPECT_LT(lostWhileFull, 20u);
    EXPECT_EQ(lostCount(), lostWhileFull) << "the disk has room again";
    std::ifstream in(stateDir / "sinks" / "energylog.jsonl", std::ios::binary);
    std::vector<int> written;
    std::size_t fragments = 0;
    for (std::string line; std::getline(in, line);) {
        const auto json = ordered_json::parse(line, nullptr, false);
        if (json.is_discarded()) {
            ++fragments;  // the start of a line the limit cut: it must have been taken off
            continue;
        }
        written.push_back(json["i"].get<int>());
    }
    EXPECT_EQ(fragments, 0u);
    EXPECT_EQ(written.size(), 20 - lostWhileFull + 1);
    EXPECT_EQ(written.back(), 20);
    EXPECT_TRUE(std::is_sorted(written.begin(), written.end()));
}

TEST_F(AJsonlSink, KeepsEveryLineWholeAndInOrderWhenThreadsAppendAtOnce) {
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
    }
    const auto lines = readLines(stateDir / "sinks" / "convo.jsonl");
    ASSERT_EQ(lines.size(), static_cast<std::size_t>(kThreads * kLinesEach));
    std::vector<int> next(kThreads, 0);
    for (const auto& line : lines) {
        EXPECT_EQ(line["i"].get<int>(), next.at(line["thread"].get<std::size_t>())++);
    }
    EXPECT_EQ(lostCount(), 0u);
}

}  // namespace
}  // namespace qv
