#include "session/PooledSerialQueue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "fakes/FakeClock.h"
#include "fakes/FakeTaskExecutor.h"
#include "platform/linux/system/LinuxTaskExecutor.h"
#include "session/AsyncSemaphore.h"

namespace qv {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;

class APooledSerialQueue : public ::testing::Test {
  protected:
    test::FakeClock clock;
    test::FakeTaskExecutor executor{clock};
    std::vector<std::string> ran;
    auto note(std::string what) {
        return [this, what = std::move(what)] { ran.push_back(what); };
    }
};

TEST_F(APooledSerialQueue, HoldsWhatIsPostedDuringAWaitAndRunsTheContinuationFirst) {
    PooledSerialQueue queue("q", executor);
    AsyncSemaphore semaphore(executor);
    std::vector<bool> outcomes;
    queue.async([&] {
        ran.push_back("start");
        queue.waitThen(semaphore, seconds(9), [&](bool signalled) {
            outcomes.push_back(signalled);
            ran.push_back("continued");
        });
    });
    queue.async(note("a"));
    executor.runUntilIdle();
    queue.async(note("b"));
    executor.runUntilIdle();
    EXPECT_EQ(ran, (std::vector<std::string>{"start"}));
    EXPECT_TRUE(queue.isWaiting());
    EXPECT_EQ(queue.pendingCount(), 2u);

    // Signalled from "another thread" (here the test's): the continuation, then a and b.
    semaphore.signal();
    executor.runUntilIdle();
    EXPECT_EQ(ran, (std::vector<std::string>{"start", "continued", "a", "b"}));
    EXPECT_EQ(outcomes, (std::vector<bool>{true}));
    EXPECT_EQ(executor.pendingTimers(), 0u) << "the time-out is cancelled";
}

TEST_F(APooledSerialQueue, TimesOutExactlyAtTheDeadlineCountedFromTheWaitAndKeepsALateSignal) {
    PooledSerialQueue queue("q", executor);
    AsyncSemaphore semaphore(executor);
    std::vector<bool> outcomes;
    auto waitingTask = [&] {
        queue.waitThen(semaphore, seconds(9),
                       [&](bool signalled) { outcomes.push_back(signalled); });
    };
    // The wait begins only when its task runs, 5 s after it was posted.
    queue.async(waitingTask);
    clock.advance(5);
    executor.runUntilIdle();
    queue.async(note("held"));
    clock.advance(8.999);
    executor.runUntilIdle();
    EXPECT_TRUE(outcomes.empty());
    clock.advance(0.001);
    executor.runUntilIdle();
    EXPECT_EQ(outcomes, (std::vector<bool>{false}));
    EXPECT_EQ(ran, (std::vector<std::string>{"held"}));

    // A signal after the time-out is not lost: the next wait takes it at once.
    semaphore.signal();
    EXPECT_EQ(semaphore.count(), 1);
    queue.async(waitingTask);
    queue.async(note("after"));
    executor.runUntilIdle();
    EXPECT_EQ(outcomes, (std::vector<bool>{false, true}));
    EXPECT_EQ(ran, (std::vector<std::string>{"held", "after"}));
    EXPECT_EQ(semaphore.count(), 0);
    EXPECT_EQ(executor.pendingTimers(), 0u);
}

TEST_F(APooledSerialQueue, BoundsTryAsyncButNotAsyncAndSharesThePoolFairly) {
    PooledSerialQueue queue("bounded", executor, 2);
    AsyncSemaphore semaphore(executor);
    queue.async([&] { queue.waitThen(semaphore, seconds(9), [](bool) {}); });
    executor.runUntilIdle();
    EXPECT_TRUE(queue.tryAsync(note("1")));
    EXPECT_TRUE(queue.tryAsync(note("2")));
    EXPECT_FALSE(queue.tryAsync(note("refused")));
    queue.async(note("control"));
    semaphore.signal();
    executor.runUntilIdle();
    EXPECT_EQ(ran, (std::vector<std::string>{"1", "2", "control"}));

    // Two busy queues on one executor take turns of kTasksPerTurn tasks.
    ran.clear();
    PooledSerialQueue x("x", executor), y("y", executor);
    const std::size_t n = PooledSerialQueue::kTasksPerTurn + 1;
    for (std::size_t i = 0; i < n; ++i) {
        x.async(note("x"));
        y.async(note("y"));
    }
    executor.runUntilIdle();
    ASSERT_EQ(ran.size(), 2 * n);
    EXPECT_EQ(ran[PooledSerialQueue::kTasksPerTurn - 1], "x");
    EXPECT_EQ(ran[PooledSerialQueue::kTasksPerTurn], "y") << "x handed its thread over";
    EXPECT_EQ(ran[2 * PooledSerialQueue::kTasksPerTurn], "x");
    EXPECT_EQ(ran.back(), "y");
}

TEST_F(APooledSerialQueue, GathersTryAsyncTasksUntilTheDelayATurnsWorthOrAnAsyncTask) {
    PooledSerialQueue queue("gathering", executor, PooledSerialQueue::kUnbounded, milliseconds(5));
    queue.tryAsync(note("a"));
    clock.advance(0.004);
    executor.runUntilIdle();
    EXPECT_TRUE(ran.empty());
    clock.advance(0.001);
    executor.runUntilIdle();
    EXPECT_EQ(ran, (std::vector<std::string>{"a"}));

    // A control task goes at once, after what was gathered before it; the timer set for the
    // gathered one finds nothing left to start.
    queue.tryAsync(note("b"));
    queue.async(note("c"));
    executor.runUntilIdle();
    EXPECT_EQ(ran, (std::vector<std::string>{"a", "b", "c"}));
    ran.clear();
    for (std::size_t i = 0; i < PooledSerialQueue::kTasksPerTurn; ++i) {
        queue.tryAsync(note("n"));
    }
    executor.runUntilIdle();
    EXPECT_EQ(ran.size(), PooledSerialQueue::kTasksPerTurn) << "a turn's worth goes at once";
    clock.advance(1);
    executor.runUntilIdle();
    EXPECT_EQ(ran.size(), PooledSerialQueue::kTasksPerTurn);
    EXPECT_EQ(executor.pendingTimers(), 0u);
}

TEST_F(APooledSerialQueue, RunsItsTasksAfterItsOwnerLetGoEvenWhileWaiting) {
    auto owned = std::make_shared<int>(7);
    std::weak_ptr<int> watch = owned;
    AsyncSemaphore semaphore(executor);
    {
        PooledSerialQueue queue("gone", executor);
        queue.async([&queue, &semaphore] { queue.waitThen(semaphore, seconds(9), [](bool) {}); });
        executor.runUntilIdle();
        queue.async([this, owned = std::move(owned)] { ran.push_back(std::to_string(*owned)); });
    }
    EXPECT_FALSE(watch.expired()) << "the held task keeps what it captured";
    clock.advance(9);
    executor.runUntilIdle();
    EXPECT_EQ(ran, (std::vector<std::string>{"7"}));
    EXPECT_TRUE(watch.expired());
}

// Real threads: many queues whose waits end from a foreign thread while tasks keep coming from
// another; each queue keeps its order and nothing waits on a thread. Run under TSan.
TEST(APooledSerialQueueOnThePool, KeepsEveryQueuesOrderWithWaitsEndedFromOtherThreads) {
    LinuxTaskExecutor executor(2, "qv-test");
    constexpr int kQueues = 64;
    constexpr int kTasks = 50;
    std::vector<std::unique_ptr<PooledSerialQueue>> queues;
    std::vector<AsyncSemaphore> semaphores;
    std::vector<std::vector<int>> seen(kQueues);
    std::vector<std::unique_ptr<std::mutex>> guards;
    for (int q = 0; q < kQueues; ++q) {
        queues.push_back(std::make_unique<PooledSerialQueue>("q", executor));
        semaphores.emplace_back(executor);
        guards.push_back(std::make_unique<std::mutex>());
    }
    std::atomic<int> waitsBegun{0};
    for (int q = 0; q < kQueues; ++q) {
        queues[q]->async([&, q] {
            queues[q]->waitThen(semaphores[q], seconds(60), [&, q](bool signalled) {
                std::lock_guard lock(*guards[q]);
                seen[q].push_back(signalled ? -1 : -2);
            });
            ++waitsBegun;
        });
    }
    std::thread poster([&] {
        for (int i = 0; i < kTasks; ++i) {
            for (int q = 0; q < kQueues; ++q) {
                queues[q]->async([&, q, i] {
                    std::lock_guard lock(*guards[q]);
                    seen[q].push_back(i);
                });
            }
        }
    });
    std::thread signaller([&] {
        for (int q = 0; q < kQueues; ++q) {
            semaphores[q].signal();
        }
    });
    poster.join();
    signaller.join();
    ASSERT_TRUE(executor.waitUntilIdle(seconds(30)));
    EXPECT_EQ(waitsBegun.load(), kQueues);
    for (int q = 0; q < kQueues; ++q) {
        std::lock_guard lock(*guards[q]);
        ASSERT_EQ(seen[q].size(), static_cast<std::size_t>(kTasks + 1)) << q;
        EXPECT_EQ(seen[q][0], -1) << "the continuation runs before the held tasks";
        for (int i = 0; i < kTasks; ++i) {
            EXPECT_EQ(seen[q][static_cast<std::size_t>(i) + 1], i);
        }
    }
}

TEST(ALinuxTaskExecutor, CancelsPendingTimersAndDropsThoseLeftWhenDestroyed) {
    auto captured = std::make_shared<int>(1);
    std::weak_ptr<int> watch = captured;
    std::atomic<int> fired{0};
    {
        LinuxTaskExecutor executor(1, "qv-test");
        const auto never = executor.schedule(std::chrono::hours(1), [&fired] { ++fired; });
        const auto soon = executor.schedule(milliseconds(0), [&fired] { ++fired; });
        executor.schedule(std::chrono::hours(1), [captured = std::move(captured)] {});
        EXPECT_TRUE(executor.cancel(never));
        EXPECT_FALSE(executor.cancel(never));
        EXPECT_FALSE(executor.waitUntilIdle(milliseconds(0))) << "a timer is still pending";
        while (fired.load() == 0) {
            std::this_thread::yield();
        }
        EXPECT_FALSE(executor.cancel(soon)) << "already fired";
        EXPECT_FALSE(watch.expired());
    }
    EXPECT_EQ(fired.load(), 1);
    EXPECT_TRUE(watch.expired()) << "the unfired timer's task was destroyed, not run";
}

}  // namespace
}  // namespace qv
