#include "platform/linux/sinks/JsonlSink.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <functional>
#include <future>
#include <nlohmann/json.hpp>
#include <string>
#include <thread>
#include <vector>

#include "fakes/FakeClock.h"
#include "fakes/FileSizeLimit.h"
#include "fakes/Notes.h"
#include "fakes/SinkLines.h"
#include "fakes/TempDirectory.h"
#include "fakes/WaitUntil.h"
#include "platform/SinkSegments.h"
#include "values/ValueJson.h"

namespace qv {
namespace {

namespace fs = std::filesystem;
using nlohmann::ordered_json;

class AJsonlSink : public ::testing::Test {
  protected:
    SinkCallbacks recording() {
        return {[this](std::string_view sink) { lost.add(sink); },
                [this](std::string_view) { ++tornRemoved; }, problems.callback(),
                [this](const std::string&) { ++filesRefused; }};
    }
    std::size_t lostCount() const { return lost.lines().size(); }
    static std::vector<ordered_json> readLines(const fs::path& path) {
        return test::readSinkLines(path);
    }

    test::TempDirectory tmp{"qvsink"};
    const fs::path stateDir = tmp.path() / "state";
    test::FakeClock clock;
    test::Notes lost;
    test::Notes problems;
    std::atomic<int> tornRemoved{0};
    std::atomic<int> filesRefused{0};
};

// Analytics events go out twice with equal payloads, and the sink reuses the last payload's
// text: only for one that prints the same, never for one that is merely equal.
TEST_F(AJsonlSink, WritesEachPayloadAsItIsWhenItEqualsTheLastOne) {
    const Dictionary inner{{"k", "v"}};
    const std::vector<Dictionary> payloads{
        {{"n", 1}, {"in", inner}},
        {{"n", 1}, {"in", inner}},
        {{"n", 1.0}, {"in", inner}},
        {{"n", true}, {"in", inner}},
        {{"in", inner}, {"n", 1}},
        {{"n", 1}, {"in", Dictionary{{"k", "w"}}}},
        {{"n", 0.0}},
        {{"n", -0.0}},
    };
    {
        JsonlSink sink(stateDir.string(), "analytics", clock, recording());
        for (const auto& payload : payloads) {
            EXPECT_TRUE(sink.append({{"payload", payload}}));
        }
    }
    std::ifstream in(stateDir / "sinks" / "analytics.jsonl");
    std::string line;
    for (const auto& payload : payloads) {
        ASSERT_TRUE(std::getline(in, line));
        std::string expected = ",\"payload\":";
        ASSERT_TRUE(QVReportingAppendJsonText(expected, Value(payload)));
        const auto at = line.find(",\"payload\":");
        ASSERT_NE(at, std::string::npos) << line;
        EXPECT_EQ(line.substr(at), expected + "}");
    }
}

TEST_F(AJsonlSink, DropsAndCountsLinesWhenItsBufferIsFull) {
    // The sink's thread is held in the loss callback of a line it cannot write (a plain file
    // where its directory should be) until the test lets it go.
    std::ofstream(tmp / "plain") << "x";
    const auto testThread = std::this_thread::get_id();
    std::promise<void> release;
    std::shared_future<void> released = release.get_future().share();
    std::atomic<bool> holding{false};
    SinkCallbacks callbacks = recording();
    callbacks.lineLost = [&, count = callbacks.lineLost](std::string_view sink) {
        count(sink);
        if (std::this_thread::get_id() != testThread && !holding.exchange(true)) {
            released.wait();
        }
    };
    std::size_t refused = 0;
    {
        JsonlSink sink((tmp / "plain").string(), "busy", clock, callbacks, /*capacity=*/2);
        sink.append({{"n", 0}});
        ASSERT_TRUE(test::waitUntil([&] { return holding.load(); }));
        fs::remove(tmp / "plain");
        for (int i = 1; i <= 5; ++i) {
            refused += sink.append({{"n", i}}) ? 0 : 1;
        }
        release.set_value();
        sink.flush();
        EXPECT_TRUE(sink.append({{"n", 6}})) << "room again once the buffer drains";
    }
    EXPECT_EQ(refused, 3u) << "two lines fit in the buffer while the thread is held";
    EXPECT_EQ(lostCount(), 1 + refused);
    std::vector<int> received;
    for (const auto& line : readLines(tmp / "plain/sinks/busy.jsonl")) {
        received.push_back(line["n"].get<int>());
    }
    EXPECT_EQ(received, (std::vector<int>{1, 2, 6}));
    EXPECT_GE(problems.containing("full"), 1u);
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
    ASSERT_EQ(problems.lines().size(), 1u) << "once, not once per line";
    EXPECT_NE(problems.lines()[0].find("cannot create"), std::string::npos);

    fs::remove(tmp / "plain");
    sink.append({{"i", 3}});
    sink.flush();
    EXPECT_EQ(lostCount(), 3u);
    const auto lines = readLines(tmp / "plain/sinks/analytics.jsonl");
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0]["i"], 3);
    ASSERT_EQ(problems.lines().size(), 2u);
    EXPECT_NE(problems.lines()[1].find("again"), std::string::npos);
}

TEST_F(AJsonlSink, LosesOnlyWhatAFullDiskRefusesAndKeepsLaterLinesWhole) {
    const std::string padding(100, 'p');
    std::size_t lostWhileFull = 0;
    {
        JsonlSink sink(stateDir.string(), "energylog", clock, recording());
        {
            test::FileSizeLimit full(1000);  // the disk fills up after a few lines
            for (int i = 0; i < 20; ++i) {
                sink.append({{"i", i}, {"pad", padding}});
            }
            sink.flush();
        }
        lostWhileFull = lostCount();
        sink.append({{"i", 20}});
    }
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
    clock.advance(0.125);                 // a time with a fraction, written whole
    {
        JsonlSink sink(stateDir.string(), "convo", clock, recording(), kThreads * kLinesEach);
        std::vector<std::thread> threads;
        for (int t = 0; t < kThreads; ++t) {
            threads.emplace_back([&, t] {
                for (int i = 0; i < kLinesEach; ++i) {
                    // The first thread's text is not UTF-8: its lines are kept whole.
                    sink.append(
                        {{"thread", t}, {"i", i}, {"pad", t == 0 ? padding + "\xff" : padding}});
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
        EXPECT_EQ(std::next(line.begin()).key(), "seq") << "after the time, before the members";
        EXPECT_EQ(line["time"].get<double>(), clock.now());
        EXPECT_EQ(line["i"].get<int>(), next.at(line["thread"].get<std::size_t>())++);
        EXPECT_EQ(line["pad"], line["thread"] == 0 ? padding + "\xEF\xBF\xBD" : padding);
    }
    EXPECT_EQ(lostCount(), 0u);
}

// --- Segments ---------------------------------------------------------------------------------

// Every line of a sink through the segment reader, as (seq, "i").
std::vector<std::pair<std::uint64_t, int>> readSink(const fs::path& sinks,
                                                    const std::string& sink) {
    std::vector<std::pair<std::uint64_t, int>> out;
    SinkLineReader reader(sinks, sink, 0);
    while (auto line = reader.next()) {
        out.emplace_back(line->seq, ordered_json::parse(line->text)["i"].get<int>());
    }
    return out;
}

std::vector<std::uint64_t> closedFirstSeqs(const fs::path& sinks, const std::string& sink) {
    std::vector<std::uint64_t> seqs;
    for (const auto& segment : QVReportingListSinkSegments(sinks, sink)) {
        if (!segment.current) {
            seqs.push_back(segment.firstSeq);
        }
    }
    return seqs;
}

TEST_F(AJsonlSink, ClosesItsSegmentPastItsSizeOrAgeAndNumbersLinesAcrossThem) {
    const fs::path sinks = stateDir / "sinks";
    const struct {
        const char* sink;
        std::uint64_t bytes;
        double seconds;
        std::vector<double> advances;  // before each line
        std::vector<std::uint64_t> closed;
    } cases[] = {
        // Lines of 46 bytes: the third passes 130 bytes, so the fourth begins a segment.
        {"bysize", 130, 1e9, std::vector<double>(8, 0), {1, 4}},
        // A day measured from the segment's first line: 100 s after it, a new one.
        {"byage", 1 << 20, 100, {0, 50, 49.9, 0.1, 50, 100, 0, 0}, {1, 4}},
        {"byboth", 130, 100, {0, 0, 150, 0, 0, 0, 0, 0}, {1, 3}},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.sink);
        {
            JsonlSink sink(stateDir.string(), c.sink, clock, recording(),
                           JsonlSink::kDefaultCapacity,
                           SinkSegmentPolicy{c.bytes, c.seconds, nullptr});
            for (std::size_t i = 0; i < c.advances.size(); ++i) {
                clock.advance(c.advances[i]);
                sink.append({{"i", static_cast<int>(i)}, {"pad", "p"}});
                sink.flush();  // one batch a line, as a quiet sink writes
            }
        }
        EXPECT_EQ(closedFirstSeqs(sinks, c.sink), c.closed);
        const auto lines = readSink(sinks, c.sink);
        ASSERT_EQ(lines.size(), c.advances.size());
        for (std::size_t i = 0; i < lines.size(); ++i) {
            EXPECT_EQ(lines[i], std::make_pair(std::uint64_t{i + 1}, static_cast<int>(i)));
        }
        for (const auto& segment : QVReportingListSinkSegments(sinks, c.sink)) {
            const auto first = readLines(segment.path).front();
            EXPECT_EQ(std::next(first.begin()).key(), "seq");
            if (!segment.current) {
                EXPECT_EQ(first["seq"].get<std::uint64_t>(), segment.firstSeq);
            }
        }
    }
    // Many lines in one batch are split at the same boundaries.
    {
        JsonlSink sink(stateDir.string(), "batched", clock, recording(),
                       JsonlSink::kDefaultCapacity, SinkSegmentPolicy{130, 1e9, nullptr});
        for (int i = 0; i < 8; ++i) {
            sink.append({{"i", i}, {"pad", "p"}});
        }
    }
    EXPECT_EQ(closedFirstSeqs(sinks, "batched"), (std::vector<std::uint64_t>{1, 4}));
    EXPECT_EQ(readSink(sinks, "batched").size(), 8u);
}

TEST_F(AJsonlSink, GoesOnFromTheNewestSegmentsLastWholeLineWhenItStartsAgain) {
    const fs::path sinks = stateDir / "sinks";
    fs::create_directories(sinks);
    const auto line = [](std::uint64_t seq, double time) {
        return "{\"time\":" + std::to_string(time) + ",\"seq\":" + std::to_string(seq) +
               ",\"i\":" + std::to_string(seq) + "}\n";
    };
    const double now = clock.now();
    const struct {
        const char* what;
        std::string current;  // "" for no current file
        std::string closed;   // lines of a closed segment beginning at 1, "" for none
        std::uint64_t expectedSeq;
        std::vector<std::uint64_t> closedAfter;
        int torn;
        std::size_t lines;  // in the current file after the new one
    } cases[] = {
        {"nothing yet", "", "", 1, {}, 0, 1},
        {"a current file with a torn line",
         line(7, now) + line(8, now) + "{\"time\":1,\"se",
         "",
         9,
         {},
         1,
         3},
        // A crash may leave more of a line than the sink reads back at once.
        {"a torn line longer than a block", std::string(5000, 'x'), "", 1, {}, 1, 1},
        {"only closed segments", "", line(1, now) + line(2, now) + line(3, now), 4, {1}, 0, 1},
        {"an empty current file", "\n", line(1, now) + line(2, now), 3, {1}, 0, 1},
        // A current segment begun more than a day ago is closed before the first new line.
        {"an old current file",
         line(4, now - 86401) + line(5, now - 86400),
         line(1, now) + line(2, now) + line(3, now),
         6,
         {1, 4},
         0,
         1},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.what);
        fs::remove_all(sinks);
        fs::create_directories(sinks);
        if (!c.current.empty()) {
            std::ofstream(sinks / "s.jsonl", std::ios::binary)
                << (c.current == "\n" ? "" : c.current);
        }
        if (!c.closed.empty()) {
            std::ofstream(sinks / QVReportingSinkSegmentName("s", 1), std::ios::binary) << c.closed;
        }
        tornRemoved = 0;
        {
            JsonlSink sink(stateDir.string(), "s", clock, recording());
            sink.append({{"i", 0}});
        }
        const auto lines = readLines(sinks / "s.jsonl");  // every line parses
        ASSERT_EQ(lines.size(), c.lines);
        EXPECT_EQ(lines.back()["seq"].get<std::uint64_t>(), c.expectedSeq);
        EXPECT_EQ(closedFirstSeqs(sinks, "s"), c.closedAfter);
        EXPECT_EQ(tornRemoved, c.torn);
    }
}

TEST_F(AJsonlSink, RefusesWhatIsNotARegularFileInItsPlaceWithoutBlocking) {
    const fs::path sinks = stateDir / "sinks";
    int fifoReader = -1;
    const struct {
        const char* what;
        std::function<void(const fs::path&)> make;
        const char* cause;
    } cases[] = {
        {"a FIFO being read",
         [&](const fs::path& p) {
             ASSERT_EQ(::mkfifo(p.c_str(), 0600), 0);
             fifoReader = ::open(p.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
         },
         "a FIFO"},
        {"a link to a file",
         [&](const fs::path& p) {
             std::ofstream(tmp / "elsewhere") << "";
             fs::create_symlink(tmp / "elsewhere", p);
         },
         "a symbolic link"},
        {"a directory", [](const fs::path& p) { fs::create_directories(p); }, "a directory"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.what);
        fs::remove_all(sinks);
        fs::create_directories(sinks);
        c.make(sinks / "odd.jsonl");
        lost.clear();
        problems.clear();
        filesRefused = 0;
        {
            JsonlSink sink(stateDir.string(), "odd", clock, recording());
            sink.append({{"i", 1}});
            sink.append({{"i", 2}});
            EXPECT_TRUE(
                sink.flushUntil(std::chrono::steady_clock::now() + std::chrono::seconds(30)))
                << "the sink's thread must not block on it";
            sink.append({{"i", 3}});
        }
        EXPECT_EQ(lostCount(), 3u);
        EXPECT_EQ(filesRefused, 1) << "said and counted once";
        const auto reported = problems.lines();
        ASSERT_EQ(reported.size(), 1u);
        EXPECT_NE(reported[0].find((sinks / "odd.jsonl").string()), std::string::npos)
            << reported[0];
        EXPECT_NE(reported[0].find(c.cause), std::string::npos) << reported[0];
        if (fifoReader >= 0) {
            char buffer[64];
            EXPECT_LE(::read(fifoReader, buffer, sizeof buffer), 0) << "nothing written to it";
            ::close(fifoReader);
            fifoReader = -1;
        }
    }
    EXPECT_EQ(fs::file_size(tmp / "elsewhere"), 0u);
}

}  // namespace
}  // namespace qv
