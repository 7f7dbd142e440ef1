#include "session/QVReportingSessionWorkerUtility.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

namespace qv {
namespace {

using MessagePtr = std::shared_ptr<QVReportingSessionMessage>;
using Messages = std::vector<MessagePtr>;

const std::vector<std::string> kABC{"A", "B", "C"};

MessagePtr message(std::initializer_list<Dictionary::Entry> entries) {
    return QVReportingSessionMessage::initWithMessage(Dictionary(entries), 1, 2);
}
// A message holding key (as its own value) and "qvreporting_timestamp" = t.
MessagePtr timed(const char* key, double t) {
    return message({{key, key}, {"qvreporting_timestamp", t}});
}
double timeOf(const MessagePtr& m) {
    return m->message().find("qvreporting_timestamp")->doubleValue();
}

TEST(CombineRapidMessages, MergesABurstAndPassesALateMessageOnUnchanged) {
    const Messages input{timed("A", 0), timed("B", 1), timed("C", 7)};
    const Dictionary lateBefore = input[2]->message();

    const Messages out = QVReportingSessionWorkerUtility::combineRapidMessages(input, kABC, 5);

    ASSERT_EQ(out.size(), 2u);
    // The kept message is the session's own object, changed in place.
    EXPECT_EQ(out[0], input[0]);
    EXPECT_EQ(input[0]->message(),
              (Dictionary{{"A", "A"}, {"qvreporting_timestamp", 1.0}, {"B", "B"}}));
    EXPECT_EQ(out[1], input[2]);
    EXPECT_EQ(out[1]->message(), lateBefore);
    EXPECT_EQ(input[1]->message().size(), 2u);  // the merged message itself is not changed
}

TEST(CombineRapidMessages, ARepeatedKeyStartsANewBurst) {
    const Messages input{timed("A", 0), timed("B", 1), timed("A", 2)};
    const Messages out = QVReportingSessionWorkerUtility::combineRapidMessages(input, kABC, 5);
    ASSERT_EQ(out.size(), 2u);
    EXPECT_EQ(out[0], input[0]);
    EXPECT_EQ(timeOf(out[0]), 1);
    EXPECT_EQ(out[1], input[2]);
    EXPECT_EQ(out[1]->message().size(), 2u);

    // The new burst keeps the repeating message and merges into it.
    const Messages again{timed("A", 0), timed("A", 1), timed("B", 2)};
    const Messages out2 = QVReportingSessionWorkerUtility::combineRapidMessages(again, kABC, 5);
    ASSERT_EQ(out2.size(), 2u);
    EXPECT_EQ(out2[1], again[1]);
    EXPECT_TRUE(again[1]->message().contains("B"));
    EXPECT_FALSE(again[0]->message().contains("B"));
}

TEST(CombineRapidMessages, MeasuresThePauseFromTheLatestMergedMessageStrictly) {
    // Each step is under the pause, though the burst as a whole is longer.
    const Messages chain{timed("A", 0), timed("B", 4), timed("C", 8)};
    const Messages out = QVReportingSessionWorkerUtility::combineRapidMessages(chain, kABC, 5);
    ASSERT_EQ(out.size(), 1u);
    EXPECT_EQ(timeOf(out[0]), 8);
    EXPECT_TRUE(out[0]->message().contains("C"));

    // Exactly the pause apart is too late.
    const Messages edge{timed("A", 0), timed("B", 5)};
    EXPECT_EQ(QVReportingSessionWorkerUtility::combineRapidMessages(edge, kABC, 5).size(), 2u);
    EXPECT_FALSE(edge[0]->message().contains("B"));

    // Out-of-order times count as a negative pause and merge.
    const Messages backwards{timed("A", 10), timed("B", 3)};
    EXPECT_EQ(QVReportingSessionWorkerUtility::combineRapidMessages(backwards, kABC, 5).size(), 1u);
}

TEST(CombineRapidMessages, ALateMessageDoesNotBecomeTheKeptOne) {
    // B is too late for A, yet C is still compared with A, and merges into it.
    const Messages input{timed("A", 0), timed("B", 7), timed("C", 3)};
    const Messages out = QVReportingSessionWorkerUtility::combineRapidMessages(input, kABC, 5);
    ASSERT_EQ(out.size(), 2u);
    EXPECT_EQ(out[0], input[0]);
    EXPECT_EQ(out[1], input[1]);
    EXPECT_TRUE(input[0]->message().contains("C"));
    EXPECT_FALSE(input[1]->message().contains("C"));
    EXPECT_EQ(timeOf(input[0]), 3);
}

TEST(CombineRapidMessages, MessagesWithoutTheKeysPassThroughWithoutEndingTheBurst) {
    const MessagePtr other = message({{"X", 1}, {"qvreporting_timestamp", 1.0}});
    const Messages input{timed("A", 0), other, nullptr, timed("B", 2)};
    const Messages out = QVReportingSessionWorkerUtility::combineRapidMessages(input, kABC, 5);
    ASSERT_EQ(out.size(), 3u);
    EXPECT_EQ(out[0], input[0]);
    EXPECT_EQ(out[1], other);
    EXPECT_EQ(out[2], nullptr);
    EXPECT_TRUE(input[0]->message().contains("B"));
    EXPECT_FALSE(other->message().contains("B"));

    EXPECT_TRUE(QVReportingSessionWorkerUtility::combineRapidMessages({}, kABC, 5).empty());
    const Messages untouched{timed("A", 0), timed("B", 1)};
    EXPECT_EQ(QVReportingSessionWorkerUtility::combineRapidMessages(untouched, {}, 5), untouched);
}

TEST(CombineRapidMessages, OnlyTheFirstKeyInKeyOrderCountsAndMergedValuesReplaceOldOnes) {
    // The second message holds B first, but A comes first among the keys to combine: A repeats,
    // so a new burst begins instead of a merge.
    const Messages input{message({{"A", 1}, {"qvreporting_timestamp", 0.0}}),
                         message({{"B", 2}, {"A", 3}, {"qvreporting_timestamp", 1.0}})};
    EXPECT_EQ(QVReportingSessionWorkerUtility::combineRapidMessages(input, kABC, 5).size(), 2u);
    // With B first among the keys, the second message's key is B and it merges.
    const Messages out =
        QVReportingSessionWorkerUtility::combineRapidMessages(input, {"B", "A"}, 5);
    ASSERT_EQ(out.size(), 1u);
    EXPECT_EQ(*input[0]->message().find("A"), Value(3));
    EXPECT_EQ(*input[0]->message().find("B"), Value(2));

    // Absent timestamps count as 0.
    const Messages untimed{message({{"A", 1}, {"note", "old"}}),
                           message({{"B", 2}, {"note", "new"}})};
    ASSERT_EQ(QVReportingSessionWorkerUtility::combineRapidMessages(untimed, kABC, 2).size(), 1u);
    EXPECT_EQ(*untimed[0]->message().find("note"), Value("new"));
    EXPECT_FALSE(untimed[0]->message().contains("qvreporting_timestamp"));
}

TEST(IsVidcallXYerrorMessage, MatchesOnlyKeysBeginningWithThePrefix) {
    auto isError = [](std::initializer_list<Dictionary::Entry> entries) {
        return QVReportingSessionWorkerUtility::isVidcallXYerrorMessage(*message(entries));
    };
    EXPECT_TRUE(isError({{"other", 1}, {"vcac_invalid_x_position", 1}}));
    EXPECT_TRUE(isError({{"vcac_invalid_", 0}}));
    EXPECT_FALSE(isError({{"vcac_invalid", 1}}));
    EXPECT_FALSE(isError({{"x_vcac_invalid_y", 1}}));
    EXPECT_FALSE(isError({{"VCAC_INVALID_Y", 1}}));
    EXPECT_FALSE(isError({{"status", "vcac_invalid_value"}}));
    EXPECT_FALSE(isError({}));
}

}  // namespace
}  // namespace qv
