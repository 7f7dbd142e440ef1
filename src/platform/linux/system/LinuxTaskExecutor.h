// The task executor on Linux: a fixed pool of threads (two by default: the work they carry is
// short, and nothing waits on them) that also serve the timers, at the utility priority class
// (a niceness a few steps above the process's), so that a burst of background work never slows
// the reporting server queue down.
//
// Timers read std::chrono::steady_clock (CLOCK_MONOTONIC), the clock the platform's steadyNow()
// reads too.
//
// Thread safety: every member may be called from any thread, the pool's own included.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <deque>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "platform/TaskExecutor.h"

namespace qv {

class LinuxTaskExecutor final : public TaskExecutor {
  public:
    static constexpr std::size_t kDefaultThreads = 2;

    // name (at most 12 characters are kept) prefixes the threads' names: "<name>-<n>".
    explicit LinuxTaskExecutor(std::size_t threads = kDefaultThreads, std::string name = "qv-pool");
    // Runs the tasks still queued, drops the timers that have not fired (their tasks are
    // destroyed unrun), then ends the threads.
    ~LinuxTaskExecutor() override;

    LinuxTaskExecutor(const LinuxTaskExecutor&) = delete;
    LinuxTaskExecutor& operator=(const LinuxTaskExecutor&) = delete;

    void execute(Task task) override;
    TimerID schedule(std::chrono::nanoseconds delay, Task task) override;
    bool cancel(TimerID id) override;

    // Blocks until no task is queued or running and no timer is pending, or until timeout has
    // passed; true when idle. For an orderly shutdown: work that waits on a timer is done too.
    bool waitUntilIdle(std::chrono::nanoseconds timeout);

  private:
    using TimePoint = std::chrono::steady_clock::time_point;
    using TimerKey = std::pair<TimePoint, TimerID>;

    void run();
    // REQUIRES: mutex_ held.
    bool idleLocked() const { return tasks_.empty() && timers_.empty() && running_ == 0; }

    std::mutex mutex_;
    std::condition_variable wake_;
    std::condition_variable idle_;
    std::deque<Task> tasks_;                           // guarded by mutex_
    std::map<TimerKey, Task> timers_;                  // guarded by mutex_; earliest first
    std::unordered_map<TimerID, TimePoint> timerDue_;  // guarded by mutex_
    TimerID nextTimer_ = 1;                            // guarded by mutex_
    std::size_t running_ = 0;                          // guarded by mutex_
    bool stopping_ = false;                            // guarded by mutex_
    std::vector<std::thread> threads_;                 // last: they use the members above
};

}  // namespace qv
