#include "QVReportingExportWindow.h"

#include <gtest/gtest.h>

#include <vector>

namespace qv::exporter {
namespace {

std::vector<std::uint64_t> seqs(const std::vector<QVReportingExportWindow::Outgoing>& lines) {
    std::vector<std::uint64_t> out;
    for (const auto& line : lines) {
        out.push_back(line.seq);
    }
    return out;
}

QVReportingExportWindow withLines(std::uint64_t cursor, std::uint64_t from, std::uint64_t to) {
    QVReportingExportWindow window(cursor);
    for (auto seq = from; seq <= to; ++seq) {
        window.add(seq, "line " + std::to_string(seq), 100.0 + static_cast<double>(seq));
    }
    return window;
}

TEST(QVReportingExportWindow, TheCursorMovesOnlyPastLinesAcknowledgedInSeqOrder) {
    struct Case {
        const char* name;
        std::vector<std::uint64_t> acks;  // in the order they arrive
        std::uint64_t cursor;
    };
    const std::vector<Case> cases = {
        {"none", {}, 0},
        {"in order", {1, 2, 3}, 3},
        {"10 before 9 leaves 8", {1, 2, 3, 4, 5, 6, 7, 8, 10}, 8},
        {"then 9 moves past 10", {1, 2, 3, 4, 5, 6, 7, 8, 10, 9}, 10},
        {"backwards", {10, 9, 8, 7, 6, 5, 4, 3, 2}, 0},
        {"all backwards", {10, 9, 8, 7, 6, 5, 4, 3, 2, 1}, 10},
        {"twice and unknown are ignored", {1, 1, 42, 2}, 2},
    };
    for (const auto& c : cases) {
        auto window = withLines(0, 1, 10);
        EXPECT_EQ(seqs(window.take(100)),
                  (std::vector<std::uint64_t>{1, 2, 3, 4, 5, 6, 7, 8, 9, 10}))
            << c.name;
        for (auto seq : c.acks) {
            window.acknowledge(seq);
        }
        EXPECT_EQ(window.cursor(), c.cursor) << c.name;
        EXPECT_EQ(window.size(), 10 - c.cursor) << c.name;
    }
}

TEST(QVReportingExportWindow, AFailureSettlesThenResendsEverythingNotAcknowledgedFromTheOldest) {
    auto window = withLines(0, 1, 6);
    window.take(4);  // 1..4 in flight
    EXPECT_TRUE(window.acknowledge(1));
    EXPECT_TRUE(window.fail(2));
    EXPECT_TRUE(window.settling());
    // Nothing goes out while 3 and 4 are in flight: the stream must see 2 before what follows.
    EXPECT_TRUE(window.take(10).empty());
    EXPECT_TRUE(window.acknowledge(4));
    EXPECT_TRUE(window.settling());
    EXPECT_FALSE(window.fail(2)) << "2 is no longer in flight";
    EXPECT_TRUE(window.fail(3));
    EXPECT_FALSE(window.settling());
    const auto resent = window.take(10);
    EXPECT_EQ(seqs(resent), (std::vector<std::uint64_t>{2, 3, 5, 6}));
    EXPECT_TRUE(resent[0].retry && resent[1].retry);
    EXPECT_FALSE(resent[2].retry || resent[3].retry);
    EXPECT_EQ(resent[0].text, "line 2");
    EXPECT_EQ(window.cursor(), 1u);
    for (auto seq : {6, 5, 3, 2}) {
        EXPECT_TRUE(window.acknowledge(seq));
    }
    EXPECT_EQ(window.cursor(), 6u);
    EXPECT_EQ(window.size(), 0u);
}

TEST(QVReportingExportWindow, LateLinesAreFoundByWhenTheyWereSentAndFailTogether) {
    auto window = withLines(0, 1, 5);
    EXPECT_EQ(window.oldestSentAt(), std::nullopt);
    window.take(2, 10.0);
    window.take(2, 11.0);
    EXPECT_EQ(window.oldestSentAt(), 10.0);
    window.acknowledge(1);
    EXPECT_EQ(window.oldestSentAt(), 10.0) << "2 went out with 1";
    window.acknowledge(2);
    EXPECT_EQ(window.oldestSentAt(), 11.0);
    window.acknowledge(4);
    EXPECT_EQ(window.failAll(), 1u);  // 3
    EXPECT_FALSE(window.settling()) << "nothing is left in flight to settle";
    EXPECT_EQ(window.oldestSentAt(), std::nullopt);
    const auto resent = window.take(10, 20.0);
    EXPECT_EQ(seqs(resent), (std::vector<std::uint64_t>{3, 5}));
    EXPECT_TRUE(resent[0].retry);
    EXPECT_EQ(window.oldestSentAt(), 20.0);
    EXPECT_EQ(window.failAll(), 2u);
    EXPECT_EQ(window.failAll(), 0u);
    EXPECT_EQ(window.cursor(), 2u);
}

TEST(QVReportingExportWindow, LinesMissingBetweenLinesReadAreExpiredAndPassedOnceTheOlderAreIn) {
    QVReportingExportWindow window(40);
    EXPECT_EQ(window.add(40, "old", 0), 0u) << "at or below the last line: ignored";
    EXPECT_EQ(window.add(41, "a", 0), 0u);
    EXPECT_EQ(window.add(45, "b", 0), 3u);  // 42..44
    EXPECT_EQ(window.add(46, "c", 0), 0u);
    window.take(10);
    window.acknowledge(45);
    window.acknowledge(46);
    EXPECT_EQ(window.cursor(), 40u) << "41 is still in flight";
    window.acknowledge(41);
    EXPECT_EQ(window.cursor(), 46u);

    // A gap before the first line of an empty window moves the cursor to just before it.
    EXPECT_EQ(window.add(100, "d", 0), 53u);
    EXPECT_EQ(window.cursor(), 99u);
    EXPECT_EQ(window.last(), 100u);
}

TEST(QVReportingExportWindow, TheOldestTimeIsThatOfTheOldestLineNotAcknowledged) {
    auto window = withLines(0, 1, 3);
    EXPECT_EQ(window.oldestTime(), 101.0);
    window.take(3);
    window.acknowledge(2);
    EXPECT_EQ(window.oldestTime(), 101.0);
    window.acknowledge(1);
    EXPECT_EQ(window.oldestTime(), 103.0);
    window.acknowledge(3);
    EXPECT_EQ(window.oldestTime(), std::nullopt);
}

}  // namespace
}  // namespace qv::exporter
