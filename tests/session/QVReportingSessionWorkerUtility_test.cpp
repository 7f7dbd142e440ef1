#include "session/QVReportingSessionWorkerUtility.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

namespace qv {
namespace {

using MessagePtr = std::shared_ptr<QVReportingSessionMessage>;
using Messages = std::vector<MessagePtr>;

MessagePtr message(Dictionary::Literal entries) {
    return QVReportingSessionMessage::initWithMessage(Dictionary(entries), 1, 2);
}
// A message holding key (as its own value) at time t.
MessagePtr timed(const char* key, double t) {
    return message({{key, key}, {"qvreporting_timestamp", t}});
}
Messages combine(const Messages& in, const std::vector<std::string>& keys = {"A", "B", "C"}) {
    return QVReportingSessionWorkerUtility::combineRapidMessages(in, keys, 5);
}

TEST(CombineRapidMessages, MergesABurstIntoItsFirstMessageAndPassesLateOnesOnUnchanged) {
    const Messages input{timed("A", 0), timed("B", 1), timed("C", 7)};
    EXPECT_EQ(combine(input), (Messages{input[0], input[2]}));
    // The kept message is the session's own object, changed in place.
    EXPECT_EQ(input[0]->message(),
              (Dictionary{{"A", "A"}, {"qvreporting_timestamp", 1.0}, {"B", "B"}}));
    EXPECT_EQ(input[2]->message().size(), 2u);  // neither the late nor the merged one changes
    EXPECT_EQ(input[1]->message().size(), 2u);

    // A repeated key starts a new burst that merges into the repeating message.
    const Messages again{timed("A", 0), timed("A", 1), timed("B", 2)};
    EXPECT_EQ(combine(again), (Messages{again[0], again[1]}));
    EXPECT_TRUE(again[1]->message().contains("B"));

    // A late message does not become the kept one: C is still compared with A.
    const Messages late{timed("A", 0), timed("B", 7), timed("C", 3)};
    EXPECT_EQ(combine(late), (Messages{late[0], late[1]}));
    EXPECT_TRUE(late[0]->message().contains("C"));

    // Messages without the keys pass through without ending the burst.
    const MessagePtr other = message({{"X", 1}, {"qvreporting_timestamp", 1.0}});
    const Messages mixed{timed("A", 0), other, nullptr, timed("B", 2)};
    EXPECT_EQ(combine(mixed), (Messages{mixed[0], other, nullptr}));
    EXPECT_TRUE(mixed[0]->message().contains("B"));
}

TEST(CombineRapidMessages, MeasuresThePauseStrictlyFromTheLatestMergedAndKeysByKeyOrder) {
    const Messages chain{timed("A", 0), timed("B", 4), timed("C", 8)};  // each step under 5
    EXPECT_EQ(combine(chain).size(), 1u);
    const Messages edge{timed("A", 0), timed("B", 5)};  // exactly the pause is too late
    EXPECT_EQ(combine(edge).size(), 2u);
    const Messages backwards{timed("A", 10), timed("B", 3)};  // a negative pause merges
    EXPECT_EQ(combine(backwards).size(), 1u);

    const Messages input{message({{"A", 1}, {"qvreporting_timestamp", 0.0}}),
                         message({{"B", 2}, {"A", 3}, {"qvreporting_timestamp", 1.0}})};
    EXPECT_EQ(combine(input).size(), 2u);  // keyed A: a repeat
    ASSERT_EQ(combine(input, {"B", "A"}).size(), 1u);
    EXPECT_EQ(*input[0]->message().find("A"), Value(3));  // merged values replace old ones
}

}  // namespace
}  // namespace qv
