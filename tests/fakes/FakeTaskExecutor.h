// A task executor that runs nothing by itself: tasks wait until the test calls runUntilIdle(),
// and timers fire then, once the test's clock has reached them. Time is the clock's steady time,
// so a test moves it with FakeClock::advance() and never sleeps.
//
// execute() and schedule() may be called from any thread (a platform service's completion, say);
// runUntilIdle() runs everything on the caller's thread.
#pragma once

#include <chrono>
#include <deque>
#include <map>
#include <mutex>
#include <unordered_map>

#include "platform/Clock.h"
#include "platform/TaskExecutor.h"

namespace qv::test {

class FakeTaskExecutor : public TaskExecutor {
  public:
    explicit FakeTaskExecutor(const Clock& clock) : clock_(clock) {}

    void execute(Task task) override {
        std::lock_guard lock(mutex_);
        tasks_.push_back(std::move(task));
    }

    TimerID schedule(std::chrono::nanoseconds delay, Task task) override {
        std::lock_guard lock(mutex_);
        const TimerID id = nextTimer_++;
        const auto due = clock_.steadyNow() +
                         std::chrono::duration_cast<std::chrono::steady_clock::duration>(delay);
        timers_.emplace(Key{due, id}, std::move(task));
        due_.emplace(id, due);
        return id;
    }

    bool cancel(TimerID id) override {
        Task dropped;
        std::lock_guard lock(mutex_);
        const auto it = due_.find(id);
        if (it == due_.end()) {
            return false;
        }
        dropped = std::move(timers_.extract(Key{it->second, id}).mapped());
        due_.erase(it);
        return true;
    }

    // Runs queued tasks, and timers that are due by the clock (earliest first, before tasks), on
    // the caller's thread until none is left. Returns how many ran.
    std::size_t runUntilIdle() {
        std::size_t ran = 0;
        for (;;) {
            Task task;
            {
                std::lock_guard lock(mutex_);
                if (!timers_.empty() && timers_.begin()->first.first <= clock_.steadyNow()) {
                    auto node = timers_.extract(timers_.begin());
                    due_.erase(node.key().second);
                    task = std::move(node.mapped());
                } else if (!tasks_.empty()) {
                    task = std::move(tasks_.front());
                    tasks_.pop_front();
                } else {
                    return ran;
                }
            }
            task();
            ++ran;
        }
    }

    std::size_t pendingTimers() const {
        std::lock_guard lock(mutex_);
        return timers_.size();
    }

  private:
    using Key = std::pair<std::chrono::steady_clock::time_point, TimerID>;

    const Clock& clock_;
    mutable std::mutex mutex_;
    std::deque<Task> tasks_;
    std::map<Key, Task> timers_;
    std::unordered_map<TimerID, std::chrono::steady_clock::time_point> due_;
    TimerID nextTimer_ = 1;
};

}  // namespace qv::test
