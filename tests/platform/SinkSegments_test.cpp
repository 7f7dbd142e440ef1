#include "platform/SinkSegments.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdint>
#include <filesystem>
#include <fstream>
#include <optional>
#include <string>
#include <vector>

#include "fakes/TempDirectory.h"

namespace qv {
namespace {

namespace fs = std::filesystem;

std::string sinkLine(std::uint64_t seq) {
    return "{\"time\":1706707501.25,\"seq\":" + std::to_string(seq) + ",\"event\":\"e" +
           std::to_string(seq) + "\"}\n";
}

void append(const fs::path& path, const std::string& text) {
    std::ofstream(path, std::ios::app | std::ios::binary) << text;
}

std::string sinkLines(std::uint64_t first, std::uint64_t last) {
    std::string text;
    for (auto seq = first; seq <= last; ++seq) {
        text += sinkLine(seq);
    }
    return text;
}

void appendLines(const fs::path& path, std::uint64_t first, std::uint64_t last) {
    append(path, sinkLines(first, last));
}

// Every line the reader has now, as seqs.
std::vector<std::uint64_t> drain(SinkLineReader& reader) {
    std::vector<std::uint64_t> seqs;
    while (auto line = reader.next()) {
        EXPECT_EQ(line->text + "\n", sinkLine(line->seq));
        seqs.push_back(line->seq);
    }
    return seqs;
}

std::vector<std::uint64_t> range(std::uint64_t first, std::uint64_t last) {
    std::vector<std::uint64_t> seqs;
    for (auto seq = first; seq <= last; ++seq) {
        seqs.push_back(seq);
    }
    return seqs;
}

class SinkSegments : public ::testing::Test {
  protected:
    fs::path closed(std::uint64_t firstSeq) const {
        return dir / QVReportingSinkSegmentName("analytics", firstSeq);
    }
    test::TempDirectory tmp{"qvsegments"};
    const fs::path dir = tmp.path();
    const fs::path current = dir / "analytics.jsonl";
};

TEST_F(SinkSegments, AreNamedByTheirFirstSeqAndListedInSeqOrderWithTheCurrentLast) {
    EXPECT_EQ(QVReportingSinkSegmentName("mtx", 123), "mtx.000000000123.jsonl");
    EXPECT_EQ(QVReportingSinkSegmentName("mtx", 1234567890123), "mtx.1234567890123.jsonl");

    for (const char* name :
         {"analytics.jsonl", "analytics.1234567890123.jsonl", "analytics.000000000002.jsonl",
          "analytics.000000000010.jsonl", "mtx.000000000001.jsonl", "analytics.12.jsonl",
          "analytics.00000000000x.jsonl", "analytics.000000000005.jsonl.tmp", "analyticsx.jsonl",
          ".hidden.jsonl"}) {
        append(dir / name, sinkLine(1));
    }
    fs::create_symlink(dir / "analytics.000000000002.jsonl", dir / "analytics.000000000003.jsonl");
    ASSERT_EQ(::mkfifo((dir / "analytics.000000000004.jsonl").c_str(), 0600), 0);
    ASSERT_EQ(::mkfifo((dir / "fifo.jsonl").c_str(), 0600), 0);
    fs::create_symlink(dir / "mtx.000000000001.jsonl", dir / "link.jsonl");

    std::vector<std::string> names;
    std::vector<std::uint64_t> firstSeqs;
    for (const auto& segment : QVReportingListSinkSegments(dir, "analytics")) {
        names.push_back(segment.path.filename().string());
        firstSeqs.push_back(segment.firstSeq);
        EXPECT_EQ(segment.current, segment.path.filename() == "analytics.jsonl");
    }
    EXPECT_EQ(names, (std::vector<std::string>{
                         "analytics.000000000002.jsonl", "analytics.000000000010.jsonl",
                         "analytics.1234567890123.jsonl", "analytics.jsonl"}));
    EXPECT_EQ(firstSeqs, (std::vector<std::uint64_t>{2, 10, 1234567890123, 0}));
    EXPECT_EQ(QVReportingListSinks(dir),
              (std::vector<std::string>{"analytics", "analytics.00000000000x", "analytics.12",
                                        "analyticsx", "mtx"}));
    EXPECT_TRUE(QVReportingListSinkSegments(dir / "missing", "analytics").empty());
    EXPECT_TRUE(QVReportingListSinks(dir / "missing").empty());
}

TEST_F(SinkSegments, LineSeqIsTheSecondMemberOrNothing) {
    const struct {
        const char* line;
        std::optional<std::uint64_t> seq;
    } cases[] = {
        {R"({"time":1706707501.25,"seq":42,"event":"x"})", 42},
        {R"({"time":1.7e9,"seq":18446744073709551615})", UINT64_MAX},
        {R"( { "time" : -1 , "seq" : 7 } )", 7},
        {R"({"time":1,"seq":18446744073709551616})", std::nullopt},  // past 64 bits
        {R"({"time":1,"event":"x","seq":3})", std::nullopt},         // not second
        {R"({"seq":3,"time":1})", std::nullopt},
        {R"({"time":1,"seq":"3"})", std::nullopt},
        {R"({"time":1,"seq":-3})", std::nullopt},
        {R"({"time":1,"seq":3.5})", std::nullopt},
        {R"({"time":1,"seq":3)", std::nullopt},  // cut short
        {R"({"time":"now","seq":3})", std::nullopt},
        {R"({"time":1,"seq":})", std::nullopt},
        {"", std::nullopt},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(QVReportingSinkLineSeq(c.line), c.seq) << c.line;
    }
}

TEST_F(SinkSegments, AReaderStartsAfterItsSeqAcrossSegmentsAndShowsExpiredOnesAsAGap) {
    appendLines(closed(1), 1, 3);
    appendLines(closed(4), 4, 6);
    appendLines(closed(7), 7, 9);
    appendLines(current, 10, 11);
    append(current, "{\"time\":1706707501.25,\"seq\":12,\"event\":");  // no line feed yet

    const struct {
        std::uint64_t after;
        bool firstExpired;
        std::vector<std::uint64_t> seqs;
    } cases[] = {
        {0, false, range(1, 11)},  {3, false, range(4, 11)}, {5, false, range(6, 11)},
        {9, false, range(10, 11)}, {10, false, {11}},        {11, false, {}},
        {500, false, {}},          {0, true, range(4, 11)},  {2, true, range(4, 11)},
        {4, true, range(5, 11)},
    };
    for (const auto& c : cases) {
        if (c.firstExpired) {
            fs::remove(closed(1));
        }
        SinkLineReader reader(dir, "analytics", c.after);
        EXPECT_EQ(drain(reader), c.seqs) << "after " << c.after;
        EXPECT_EQ(reader.lastSeq(), c.seqs.empty() ? c.after : c.seqs.back());
    }

    // Lines without a seq, or not above the last one, are passed over; the torn line counts once
    // it is whole.
    SinkLineReader reader(dir, "analytics", 0);
    EXPECT_EQ(drain(reader), range(4, 11));
    append(current, "\"e12\"}\n" + std::string("{\"time\":1,\"event\":\"old\"}\n") + sinkLine(5) +
                        "not json\n" + sinkLine(13));
    EXPECT_EQ(drain(reader), (std::vector<std::uint64_t>{12, 13}));
}

TEST_F(SinkSegments, AFollowingReaderFinishesARenamedSegmentThenTakesTheNewCurrentOne) {
    // The daemon's side: an O_APPEND descriptor on the current segment.
    const auto openCurrent = [&] {
        return ::open(current.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
    };
    const auto write = [](int fd, std::uint64_t first, std::uint64_t last) {
        const std::string text = sinkLines(first, last);
        ASSERT_EQ(::write(fd, text.data(), text.size()), static_cast<ssize_t>(text.size()));
    };

    SinkLineReader reader(dir, "analytics", 0);
    EXPECT_EQ(drain(reader), std::vector<std::uint64_t>{});  // nothing there yet
    int fd = openCurrent();
    write(fd, 1, 3);
    EXPECT_EQ(drain(reader), range(1, 3));
    // Lines land after the reader reached the end, then the segment is renamed: the reader takes
    // them through its descriptor before it moves on.
    write(fd, 4, 5);
    fs::rename(current, closed(1));
    EXPECT_EQ(drain(reader), range(4, 5));  // the new current one is not there yet
    ::close(fd);
    fd = openCurrent();
    write(fd, 6, 7);
    EXPECT_EQ(drain(reader), range(6, 7));

    // Two rotations while the reader looks away, the older closed segment expired meanwhile.
    write(fd, 8, 9);
    ::close(fd);
    fs::rename(current, closed(6));
    fd = openCurrent();
    write(fd, 10, 12);
    ::close(fd);
    fs::rename(current, closed(10));
    fs::remove(closed(1));
    fd = openCurrent();
    write(fd, 13, 13);
    EXPECT_EQ(drain(reader), range(8, 13));

    // The daemon restarting cuts a torn last line the reader had half read; lines written after
    // it are read from where it began.
    const std::string torn = "{\"time\":1,\"seq\":14,\"ev";
    append(current, torn);
    EXPECT_EQ(drain(reader), std::vector<std::uint64_t>{});
    fs::resize_file(current, fs::file_size(current) - torn.size());
    write(fd, 14, 15);
    EXPECT_EQ(drain(reader), range(14, 15));
    ::close(fd);

    // Something that is not a regular file in the current segment's place is passed over: the
    // reader neither blocks on a pipe nor follows a link.
    fs::rename(current, closed(14));
    ASSERT_EQ(::mkfifo(current.c_str(), 0600), 0);
    EXPECT_EQ(drain(reader), std::vector<std::uint64_t>{});
    fs::remove(current);
    appendLines(dir / "elsewhere.jsonl", 16, 17);
    fs::create_symlink(dir / "elsewhere.jsonl", current);
    EXPECT_EQ(drain(reader), std::vector<std::uint64_t>{});
    fs::remove(current);
    appendLines(current, 16, 16);
    EXPECT_EQ(drain(reader), std::vector<std::uint64_t>{16});
}

}  // namespace
}  // namespace qv
