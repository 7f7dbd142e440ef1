#include "QVBridgeEventQueue.h"

#include <thread>

#include <gtest/gtest.h>

namespace qv::bridge {
namespace {

using Kind = QVBridgeEvent::Kind;
using namespace std::chrono_literals;

QVBridgeEvent event(Kind kind, std::int64_t id) {
    QVBridgeEvent e;
    e.kind = kind;
    e.reporterID = id;
    return e;
}

using Events = std::vector<std::pair<Kind, std::int64_t>>;

Events drain(QVBridgeEventQueue& q) {
    Events out;
    QVBridgeEvent e;
    while (q.pop(e, 0ms)) {
        out.emplace_back(e.kind, e.reporterID);
    }
    return out;
}

TEST(QVBridgeEventQueue, MessagesPastTheBoundAreDroppedAndCountedButSessionOperationsAreNot) {
    QVBridgeStats stats;
    QVBridgeEventQueue q(2, stats);
    EXPECT_TRUE(q.push(event(Kind::kOpen, 1)));
    EXPECT_TRUE(q.push(event(Kind::kMessage, 1)));
    EXPECT_TRUE(q.push(event(Kind::kMessage, 1)));
    EXPECT_FALSE(q.push(event(Kind::kMessage, 1)));
    EXPECT_TRUE(q.push(event(Kind::kStart, 1)));
    EXPECT_EQ(stats.eventsDropped(), 1u);
    EXPECT_EQ(q.messages(), 2u);
    QVBridgeEvent e;
    ASSERT_TRUE(q.pop(e, 0ms));
    ASSERT_TRUE(q.pop(e, 0ms));  // one message out: room for one more
    EXPECT_TRUE(q.push(event(Kind::kMessage, 1)));
    EXPECT_FALSE(q.push(event(Kind::kMessage, 1)));
    EXPECT_EQ(stats.eventsDropped(), 2u);
}

TEST(QVBridgeEventQueue, AStreamGoneBeforeTheSenderSawItLeavesNothingBehind) {
    QVBridgeStats stats;
    QVBridgeEventQueue q(8, stats);
    q.push(event(Kind::kOpen, 1));
    q.push(event(Kind::kOpen, 2));
    q.push(event(Kind::kStart, 1));
    q.push(event(Kind::kMessage, 1));
    q.push(event(Kind::kMessage, 2));
    q.push(event(Kind::kClose, 1));
    EXPECT_EQ(q.messages(), 1u);
    EXPECT_EQ(drain(q), (Events{{Kind::kOpen, 2}, {Kind::kMessage, 2}}));
    // Once the sender took the open, the close must reach it.
    q.push(event(Kind::kClose, 2));
    EXPECT_EQ(drain(q), (Events{{Kind::kClose, 2}}));
}

TEST(QVBridgeEventQueue, CloseDrainsThenStopsWaiting) {
    QVBridgeStats stats;
    QVBridgeEventQueue q(8, stats);
    q.push(event(Kind::kMessage, 1));
    std::thread closer([&] { q.close(); });
    closer.join();
    EXPECT_FALSE(q.push(event(Kind::kMessage, 1)));
    QVBridgeEvent e;
    EXPECT_TRUE(q.pop(e, 10s));
    // Closed and empty: false at once; a pop that waited out its time-out would hang the test.
    EXPECT_FALSE(q.pop(e, std::chrono::hours(24)));
}

}  // namespace
}  // namespace qv::bridge
