// The serial queue, the repeating timer and the bounded wait: the threads everything else runs on.
#include <gtest/gtest.h>

#include <cmath>

#include <atomic>
#include <future>
#include <thread>
#include <vector>

#include "fakes/MemoryLogSink.h"
#include "platform/BoundedWriter.h"
#include "session/QVReportingWait.h"
#include "session/RepeatingTimer.h"
#include "session/SerialQueue.h"

namespace qv {
namespace {

TEST(ASerialQueue, RunsTasksOneAtATimeInPostOrderFromManyThreads) {
    std::vector<int> seen;  // touched only on the queue
    std::atomic<int> running{0};
    std::atomic<bool> overlapped{false};
    {
        SerialQueue queue("test.queue");
        std::vector<std::thread> posters;
        for (int t = 0; t < 4; ++t) {
            posters.emplace_back([&, t] {
                for (int i = 0; i < 250; ++i) {
                    queue.async([&, t, i] {
                        if (running.fetch_add(1) != 0)
                            overlapped = true;
                        seen.push_back(t * 1000 + i);
                        running.fetch_sub(1);
                    });
                }
            });
        }
        for (auto& p : posters)
            p.join();
    }  // the destructor runs everything posted before it
    ASSERT_EQ(seen.size(), 1000u);
    EXPECT_FALSE(overlapped);
    // Each poster's tasks keep their order.
    std::vector<int> last(4, -1);
    for (int v : seen) {
        EXPECT_GT(v % 1000, last[v / 1000]);
        last[v / 1000] = v % 1000;
    }
}

TEST(ASerialQueue, SyncWaitsForTheTaskAndRunsInlineWhenAlreadyOnTheQueue) {
    SerialQueue queue("test.sync");
    EXPECT_FALSE(queue.isCurrent());
    bool onQueue = false, nested = false;
    queue.sync([&] {
        onQueue = queue.isCurrent();
        queue.sync([&] { nested = true; });  // would deadlock if it waited on itself
    });
    EXPECT_TRUE(onQueue);
    EXPECT_TRUE(nested);
    EXPECT_EQ(&QVReportingUtilityGetReportingServerQueue(),
              &QVReportingUtilityGetReportingServerQueue());
    EXPECT_EQ(QVReportingUtilityGetReportingServerQueue().label(),
              "com.korvane.qvsound.reporting.server");
}

TEST(ARepeatingTimer, FiresUntilItsHandlerInvalidatesAndDestroysIt) {
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

TEST(ARepeatingTimer, IsInvalidOnceInvalidated) {
    RepeatingTimer timer(std::chrono::hours(1), [] {});
    EXPECT_TRUE(timer.isValid());
    timer.invalidate();
    EXPECT_FALSE(timer.isValid());
}

TEST(AWait, ReturnsAtOnceForASetFlagSeesASignalAndLogsATimeoutAtErrorLevel) {
    test::ScopedMemoryLog log;
    QVReportingCondition c;
    bool flag = true;
    EXPECT_TRUE(
        QVReportingUtilityWait(c, 5, &flag, "waiting", "timed out", QVReportingTraceCategory()));
    EXPECT_TRUE(log->lines().empty()) << "a set flag means no wait and no log";

    flag = false;
    std::thread signaller([&] { QVReportingUtilitySignal(c, &flag); });
    EXPECT_TRUE(QVReportingUtilityWait(c, 60, &flag, "waiting for trace", "trace timed out",
                                       QVReportingTraceCategory()));
    signaller.join();
    EXPECT_TRUE(flag);
    EXPECT_FALSE(log->contains("trace timed out"));

    log->clear();
    flag = false;
    EXPECT_FALSE(QVReportingUtilityWait(c, 0.001, &flag, "waiting for capture", "capture timed out",
                                        QVReportingICXLogCategory()));
    EXPECT_FALSE(QVReportingUtilityWait(c, std::nan(""), &flag, "w", "nan timed out",
                                        QVReportingICXLogCategory()));
    const auto lines = log->lines();
    ASSERT_GE(lines.size(), 2u);
    EXPECT_EQ(lines[0].level, LogLevel::Info);
    EXPECT_NE(lines[0].text.find("waiting for capture"), std::string::npos);
    EXPECT_EQ(lines[0].category, "qvrb");
    EXPECT_TRUE(log->contains("capture timed out"));
    for (const auto& l : lines) {
        if (l.text.find("timed out") != std::string::npos) {
            EXPECT_EQ(l.level, LogLevel::Error);
        }
    }
}

TEST(ABoundedWriter, RefusesItemsBeyondItsCapacityWithoutWaitingAndWritesTheRestInOrder) {
    std::promise<void> release;
    std::shared_future<void> gate = release.get_future().share();
    std::vector<int> written;
    std::size_t refused = 0;
    {
        BoundedWriter<int> writer(2, [&](int& v) {
            gate.wait();  // a stalled consumer
            written.push_back(v);
        });
        for (int i = 0; i < 50; ++i) {
            refused += writer.push(i) ? 0 : 1;
        }
        release.set_value();
        writer.flush();
    }
    // One item may already be in the writer's hands, two more in the buffer.
    EXPECT_GE(refused, 47u);
    EXPECT_EQ(written.size() + refused, 50u);
    EXPECT_TRUE(std::is_sorted(written.begin(), written.end()));
}

}  // namespace
}  // namespace qv
