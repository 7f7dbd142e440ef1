#include "platform/linux/LinuxNotificationCenter.h"

#include <gtest/gtest.h>

#include <atomic>
#include <deque>
#include <mutex>
#include <thread>
#include <vector>

namespace qv {
namespace {

using Token = NotificationCenter::Token;

// A runner that only queues tasks; the test decides when they run.
class ManualRunner {
  public:
    NotificationCenter::TaskRunner runner() {
        return [this](std::function<void()> task) {
            std::lock_guard lock(mutex_);
            tasks_.push_back(std::move(task));
        };
    }
    std::size_t pending() {
        std::lock_guard lock(mutex_);
        return tasks_.size();
    }
    void runAll() {
        std::deque<std::function<void()>> tasks;
        {
            std::lock_guard lock(mutex_);
            tasks.swap(tasks_);
        }
        for (auto& task : tasks) {
            task();
        }
    }

  private:
    std::mutex mutex_;
    std::deque<std::function<void()>> tasks_;
};

NotificationCenter::TaskRunner inlineRunner() {
    return [](std::function<void()> task) { task(); };
}

TEST(ALinuxNotificationCenter, HandsOutPositiveIncreasingTokensAndKeepsStatesByName) {
    LinuxNotificationCenter center;
    const auto a = center.registerNotification("ringer", inlineRunner(), [](Token) {});
    const auto b = center.registerNotification("ringer", inlineRunner(), [](Token) {});
    const auto c = center.registerNotification("other", inlineRunner(), [](Token) {});
    ASSERT_TRUE(a && b && c);
    EXPECT_GT(*a, 0);
    EXPECT_LT(*a, *b);
    EXPECT_LT(*b, *c);

    EXPECT_EQ(center.stateOf("ringer"), 0u);
    EXPECT_EQ(center.getState(*a), 0u);
    center.post("ringer", 1);
    center.post("ringer", 0xFFFFFFFFFFFFFFFFull);
    EXPECT_EQ(center.stateOf("ringer"), 0xFFFFFFFFFFFFFFFFull);
    EXPECT_EQ(center.getState(*b), 0xFFFFFFFFFFFFFFFFull);
    EXPECT_EQ(center.getState(*c), 0u);
    EXPECT_FALSE(center.getState(9999));

    // A cancelled token no longer answers, and tokens are not handed out again.
    center.cancel(*a);
    center.cancel(*a);
    center.cancel(12345);
    EXPECT_FALSE(center.getState(*a));
    const auto d = center.registerNotification("ringer", inlineRunner(), [](Token) {});
    ASSERT_TRUE(d);
    EXPECT_GT(*d, *c);

    // Registrations need somewhere to run and something to run.
    EXPECT_FALSE(center.registerNotification("x", {}, [](Token) {}));
    EXPECT_FALSE(center.registerNotification("x", inlineRunner(), {}));
}

TEST(ALinuxNotificationCenter, RunsHandlersOfThePostedNameOnlyThroughTheirRunners) {
    LinuxNotificationCenter center;
    ManualRunner runner;
    std::vector<std::pair<std::string, Token>> calls;
    const auto ringer = center.registerNotification(
        "ringer", runner.runner(), [&](Token t) { calls.emplace_back("ringer", t); });
    const auto feature = center.registerNotification(
        "feature", runner.runner(), [&](Token t) { calls.emplace_back("feature", t); });
    ASSERT_TRUE(ringer && feature);

    center.post("ringer", 1);
    center.post("ringer", 2);
    center.post("unwatched", 3);
    EXPECT_TRUE(calls.empty());  // nothing runs on the poster's thread
    EXPECT_EQ(runner.pending(), 2u);
    runner.runAll();
    const std::vector<std::pair<std::string, Token>> expected{{"ringer", *ringer},
                                                              {"ringer", *ringer}};
    EXPECT_EQ(calls, expected);
}

TEST(ALinuxNotificationCenter, DoesNotRunAHandlerCancelledBeforeItsTaskRan) {
    LinuxNotificationCenter center;
    ManualRunner runner;
    int calls = 0;
    const auto token =
        center.registerNotification("ringer", runner.runner(), [&](Token) { ++calls; });
    ASSERT_TRUE(token);
    center.post("ringer", 1);
    ASSERT_EQ(runner.pending(), 1u);
    center.cancel(*token);
    runner.runAll();
    center.post("ringer", 0);
    runner.runAll();
    EXPECT_EQ(calls, 0);
}

TEST(ALinuxNotificationCenter, TellsThePostObserverAfterEveryPostAndLetsHandlersPostAgain) {
    LinuxNotificationCenter center;
    std::vector<std::pair<std::string, std::uint64_t>> observed;
    center.setPostObserver(
        [&](const std::string& name, std::uint64_t state) { observed.emplace_back(name, state); });
    // An inline handler that posts from inside a post: no deadlock, and the observer sees the
    // inner post first because the outer one's observer call comes after its handlers.
    std::vector<std::uint64_t> seenByHandler;
    ASSERT_TRUE(center.registerNotification("ringer", inlineRunner(), [&](Token t) {
        seenByHandler.push_back(*center.getState(t));
        if (seenByHandler.size() == 1) {
            center.post("echo", 7);
        }
    }));
    center.post("ringer", 1);
    center.post("nobody", 5);
    EXPECT_EQ(seenByHandler, std::vector<std::uint64_t>{1});
    const std::vector<std::pair<std::string, std::uint64_t>> expected{
        {"echo", 7}, {"ringer", 1}, {"nobody", 5}};
    EXPECT_EQ(observed, expected);

    center.setPostObserver({});
    center.post("ringer", 0);
    EXPECT_EQ(observed.size(), 3u);
}

TEST(ALinuxNotificationCenter, BoundsTheNamesItKeepsButAlwaysKeepsWatchedOnes) {
    LinuxNotificationCenter center(/*maxNames=*/2);
    ASSERT_TRUE(center.registerNotification("watched", inlineRunner(), [](Token) {}));
    center.post("a", 1);
    center.post("b", 2);
    center.post("c", 3);  // table full: not kept
    center.post("a", 4);  // known names still change
    center.post("watched", 5);
    EXPECT_EQ(center.stateOf("a"), 4u);
    EXPECT_EQ(center.stateOf("b"), 2u);
    EXPECT_EQ(center.stateOf("c"), 0u);
    EXPECT_EQ(center.stateOf("watched"), 5u);
    EXPECT_EQ(center.droppedStates(), 1u);

    // Overlong names are not kept even while there is room.
    LinuxNotificationCenter roomy;
    const std::string longest(LinuxNotificationCenter::kMaxNameLength, 'n');
    roomy.post(longest, 1);
    roomy.post(longest + "n", 2);
    EXPECT_EQ(roomy.stateOf(longest), 1u);
    EXPECT_EQ(roomy.stateOf(longest + "n"), 0u);
    EXPECT_EQ(roomy.droppedStates(), 1u);
}

TEST(ALinuxNotificationCenter, StaysConsistentUnderConcurrentPostsRegistrationsAndCancels) {
    LinuxNotificationCenter center;
    std::atomic<int> handled{0};
    std::atomic<int> observed{0};
    center.setPostObserver([&](const std::string&, std::uint64_t) { ++observed; });
    const auto steady = center.registerNotification("n", inlineRunner(), [&](Token) { ++handled; });
    ASSERT_TRUE(steady);
    constexpr int kPostsPerThread = 200;
    std::vector<std::thread> threads;
    for (int t = 0; t < 3; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; i < kPostsPerThread; ++i) {
                center.post("n", static_cast<std::uint64_t>(t));
                (void)center.stateOf("n");
            }
        });
    }
    threads.emplace_back([&] {
        for (int i = 0; i < kPostsPerThread; ++i) {
            if (auto token = center.registerNotification("n", inlineRunner(), [](Token) {})) {
                (void)center.getState(*token);
                center.cancel(*token);
            }
        }
    });
    for (auto& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(handled.load(), 3 * kPostsPerThread);
    EXPECT_EQ(observed.load(), 3 * kPostsPerThread);
    EXPECT_LT(center.stateOf("n"), 3u);
}

}  // namespace
}  // namespace qv
