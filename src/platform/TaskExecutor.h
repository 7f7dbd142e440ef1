// Threads for work that may not run on the reporting server queue: a small shared pool that runs
// short tasks, and one-shot timers. Serial queues of workers (PooledSerialQueue) sit on top of it,
// so thousands of sessions can each have a queue of their own without a thread each; a queue that
// waits for a platform service is suspended on a timer, never parked on a thread.
//
// Thread safety: every member may be called from any thread, tasks and timer handlers included.
// Tasks and handlers never run on the caller's thread inside the call that hands them in.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>

namespace qv {

class TaskExecutor {
  public:
    using Task = std::function<void()>;
    using TimerID = std::uint64_t;

    virtual ~TaskExecutor() = default;

    // Runs task soon on one of the executor's threads. Tasks may run in parallel with each other;
    // order between them is not promised (serial queues provide it).
    virtual void execute(Task task) = 0;
    // Runs task once, on one of the executor's threads, when delay has passed from this call on
    // the executor's monotonic clock. Returns an ID for cancel(); never 0.
    virtual TimerID schedule(std::chrono::nanoseconds delay, Task task) = 0;
    // Cancels a timer that has not fired: its task is destroyed without running. True when it was
    // cancelled; false when it already fired (or is firing) or was never scheduled.
    virtual bool cancel(TimerID id) = 0;
};

}  // namespace qv
