#include "platform/linux/system/LinuxNotificationCenter.h"

#include <gtest/gtest.h>

#include <atomic>
#include <functional>
#include <thread>
#include <vector>

namespace qv {
namespace {

using Token = NotificationCenter::Token;

NotificationCenter::TaskRunner inlineRunner() {
    return [](std::function<void()> task) { task(); };
}

TEST(ALinuxNotificationCenter, KeepsStatesByNameAndRunsOnlyLiveHandlersThroughTheirRunners) {
    LinuxNotificationCenter center;
    std::vector<std::function<void()>> queued;  // the test decides when tasks run
    const NotificationCenter::TaskRunner queue = [&](std::function<void()> task) {
        queued.push_back(std::move(task));
    };
    std::vector<std::pair<std::string, Token>> calls;
    const auto ringer = center.registerNotification(
        "ringer", queue, [&](Token t) { calls.emplace_back("ringer", t); });
    const auto feature = center.registerNotification(
        "feature", queue, [&](Token t) { calls.emplace_back("feature", t); });
    const auto doomed = center.registerNotification(
        "ringer", queue, [&](Token t) { calls.emplace_back("doomed", t); });
    ASSERT_TRUE(ringer && feature && doomed);
    EXPECT_GT(*ringer, 0);
    EXPECT_LT(*ringer, *feature);

    center.post("ringer", 1);
    center.post("ringer", 0xFFFFFFFFFFFFFFFFull);
    center.post("unwatched", 3);
    EXPECT_TRUE(calls.empty()) << "nothing runs on the poster's thread";
    ASSERT_EQ(queued.size(), 4u);
    center.cancel(*doomed);  // cancelled after its tasks were queued: they must not run it
    center.cancel(*doomed);
    for (auto& task : queued) {
        task();
    }
    EXPECT_EQ(calls, (std::vector<std::pair<std::string, Token>>{{"ringer", *ringer},
                                                                 {"ringer", *ringer}}));
    EXPECT_EQ(center.getState(*ringer), 0xFFFFFFFFFFFFFFFFull);
    EXPECT_EQ(center.getState(*feature), 0u);
    EXPECT_EQ(center.stateOf("unwatched"), 3u);
    EXPECT_FALSE(center.getState(*doomed));
    EXPECT_FALSE(center.getState(9999));
    // Tokens are not handed out again; a registration needs a runner and a handler.
    EXPECT_GT(*center.registerNotification("x", queue, [](Token) {}), *doomed);
    EXPECT_FALSE(center.registerNotification("x", {}, [](Token) {}));
    EXPECT_FALSE(center.registerNotification("x", inlineRunner(), {}));
}

// That the bus hears of every post, watched or not, is the end-to-end PulsarOverloads test's (its
// dropped-spinlog signal, which no one watches); here, that a cleared observer hears no more.
TEST(ALinuxNotificationCenter, TellsThePostObserverOfEveryPostUntilItIsCleared) {
    LinuxNotificationCenter center;
    std::vector<std::pair<std::string, std::uint64_t>> observed;
    center.setPostObserver(
        [&](const std::string& name, std::uint64_t state) { observed.emplace_back(name, state); });
    center.post("nobody", 5);
    center.setPostObserver({});
    center.post("nobody", 0);
    EXPECT_EQ(observed, (std::vector<std::pair<std::string, std::uint64_t>>{{"nobody", 5}}));
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
