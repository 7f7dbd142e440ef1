#include "platform/BoundedWriter.h"

#include <gtest/gtest.h>

#include <chrono>
#include <mutex>
#include <vector>

#include "fakes/WaitUntil.h"

namespace qv {
namespace {

// The linger is an hour: each way of cutting it short must, or the items are not written in time.
TEST(ABoundedWriter, WritesBeforeItsLingerEndsWhenFlushedHalfFullOrEnded) {
    std::mutex mutex;
    std::vector<int> written;
    const auto count = [&] {
        std::lock_guard lock(mutex);
        return written.size();
    };
    {
        BoundedWriter<int> writer(8, [&](int& item) {
            std::lock_guard lock(mutex);
            written.push_back(item);
        });
        writer.setLinger(std::chrono::hours(1));
        writer.setMaxBytes(100);

        ASSERT_TRUE(writer.push(1));
        EXPECT_TRUE(writer.flushUntil(std::chrono::steady_clock::now() + std::chrono::seconds(30)));
        EXPECT_EQ(count(), 1u);

        // Half the count, then half the bytes, wake the writer before pushes would be refused.
        for (int item = 2; item <= 5; ++item) {
            ASSERT_TRUE(writer.push(item));
        }
        EXPECT_TRUE(test::waitUntil([&] { return count() == 5; }));
        ASSERT_TRUE(writer.push(6, 50));
        EXPECT_TRUE(test::waitUntil([&] { return count() == 6; }));

        ASSERT_TRUE(writer.push(7));
    }
    EXPECT_EQ(written, (std::vector<int>{1, 2, 3, 4, 5, 6, 7}));
}

}  // namespace
}  // namespace qv
