// The serial queue, the repeating timer and the bounded wait: the threads everything runs on.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cmath>
#include <future>
#include <string>
#include <thread>
#include <vector>

#include "fakes/MemoryLogSink.h"
#include "session/QVReportingWait.h"
#include "session/RepeatingTimer.h"
#include "session/SerialQueue.h"

namespace qv {
namespace {

TEST(ASerialQueue, RunsTasksOneAtATimeInPostOrderAndSyncRunsInlineOnItself) {
    std::vector<int> seen;  // touched only on the queue
    std::atomic<int> running{0};
    std::atomic<bool> overlapped{false};
    {
        SerialQueue queue("test.queue");
        auto post = [&](int t) {
            for (int i = 0; i < 250; ++i) {
                queue.async([&, t, i] {
                    overlapped = overlapped || running.fetch_add(1) != 0;
                    seen.push_back(t * 1000 + i);
                    running = 0;
                });
            }
        };
        std::jthread p1(post, 1), p2(post, 2), p3(post, 3);
        post(0);
        bool nested = false;
        queue.sync([&] { queue.sync([&] { nested = queue.isCurrent(); }); });  // no deadlock
        EXPECT_TRUE(nested);
    }  // the destructor runs everything posted before it
    ASSERT_EQ(seen.size(), 1000u);
    EXPECT_FALSE(overlapped);
    std::vector<int> last(4, -1);  // each poster's tasks keep their order
    for (int v : seen) {
        EXPECT_GT(v % 1000, last[v / 1000]);
        last[v / 1000] = v % 1000;
    }
}

TEST(ASerialQueue, LetsLanesTakeTurnsAndSyncWaitsForEveryLane) {
    SerialQueue queue("test.queue");
    std::promise<void> release;
    std::shared_future<void> gate = release.get_future().share();
    std::vector<std::string> seen;         // touched only on the queue
    queue.async([gate] { gate.wait(); });  // holds the queue while the lanes fill
    const auto flooder = queue.makeLane();
    const auto other = queue.makeLane();
    for (int i = 0; i < 100; ++i) {
        queue.async(flooder, [&seen, i] { seen.push_back("f" + std::to_string(i)); });
    }
    queue.async(other, [&seen] { seen.push_back("o0"); });
    queue.async(other, [&seen] { seen.push_back("o1"); });
    std::thread barrier([&] { queue.sync([&seen] { seen.push_back("sync"); }); });
    queue.async(flooder, [&seen] { seen.push_back("late"); });
    release.set_value();
    barrier.join();
    queue.sync([] {});
    // A backlog of 100 holds the other lane's calls up by one task each, not by 100; the barrier
    // comes once all 102 tasks posted before it ran. (The late task was posted after the sync
    // began, so it may run before or after it, but after every other task of its lane.)
    ASSERT_EQ(seen.size(), 104u);
    EXPECT_EQ((std::vector<std::string>(seen.begin(), seen.begin() + 4)),
              (std::vector<std::string>{"f0", "o0", "f1", "o1"}));
    const auto at = [&](const std::string& s) { return std::find(seen.begin(), seen.end(), s); };
    EXPECT_EQ(std::count_if(seen.begin(), at("sync"), [](auto& s) { return s != "late"; }), 102);
    EXPECT_GT(at("late"), at("f99"));
}

TEST(ASerialQueue, HoldsBackWakeUpsInABatchLosingNoneAcrossNestedBatchesOfTwoQueues) {
    SerialQueue a("test.a");
    SerialQueue b("test.b");
    a.sync([] {});  // both threads idle, waiting for a wake-up
    b.sync([] {});
    std::vector<int> seenA, seenB;  // touched only on their queues
    std::promise<void> doneA, doneB, doneAfter;
    {
        SerialQueue::WakeBatch outer(a);
        for (int i = 0; i < 100; ++i) {
            a.async([&seenA, i] { seenA.push_back(i); });
        }
        {
            // An inner batch of another queue holds back only that queue's wake-up.
            SerialQueue::WakeBatch inner(b);
            b.async([&seenB] { seenB.push_back(1); });
            b.async([&doneB] { doneB.set_value(); });
            a.async([&doneA] { doneA.set_value(); });
        }
        ASSERT_EQ(doneB.get_future().wait_for(std::chrono::seconds(30)), std::future_status::ready);
    }
    ASSERT_EQ(doneA.get_future().wait_for(std::chrono::seconds(30)), std::future_status::ready);
    // Past its batch, a post wakes the queue at once again.
    a.async([&doneAfter] { doneAfter.set_value(); });
    ASSERT_EQ(doneAfter.get_future().wait_for(std::chrono::seconds(30)), std::future_status::ready);
    a.sync([] {});
    EXPECT_EQ(seenA.size(), 100u);
    EXPECT_TRUE(std::is_sorted(seenA.begin(), seenA.end()));
    EXPECT_EQ(seenB, std::vector<int>{1});
}

TEST(ARepeatingTimer, FiresUntilItsHandlerDestroysIt) {
    std::promise<int> done;
    std::atomic<int> ticks{0};
    std::unique_ptr<RepeatingTimer> timer;
    std::mutex timerMutex;
    {
        std::lock_guard lock(timerMutex);
        timer = std::make_unique<RepeatingTimer>(std::chrono::milliseconds(1), [&] {
            if (++ticks == 3) {
                std::lock_guard lock(timerMutex);
                timer.reset();  // destroyed from its own handler
                done.set_value(ticks.load());
            }
        });
    }
    EXPECT_EQ(done.get_future().get(), 3);
    std::lock_guard lock(timerMutex);
    EXPECT_EQ(timer, nullptr);
}

TEST(AWait, ReturnsAtOnceForASetFlagSeesASignalAndLogsATimeoutAsAnError) {
    test::ScopedMemoryLog log;
    QVReportingCondition c;
    bool flag = true;
    EXPECT_TRUE(QVReportingUtilityWait(c, 5, &flag, "w", "timed out", QVReportingTraceCategory()));
    flag = false;
    std::thread signaller([&] { QVReportingUtilitySignal(c, &flag); });
    EXPECT_TRUE(QVReportingUtilityWait(c, 60, &flag, "w", "timed out", QVReportingTraceCategory()));
    signaller.join();
    EXPECT_FALSE(log->contains("timed out"));
    for (const double timeout : {0.001, std::nan("")}) {
        flag = false;
        EXPECT_FALSE(QVReportingUtilityWait(c, timeout, &flag, "w", "capture timed out",
                                            QVReportingICXLogCategory()));
    }
    const auto lines = log->lines();
    EXPECT_EQ(std::count_if(lines.begin(), lines.end(),
                            [](const auto& l) {
                                return l.level == LogLevel::Error &&
                                       l.text.find("capture timed out") != std::string::npos;
                            }),
              2);
}

}  // namespace
}  // namespace qv
