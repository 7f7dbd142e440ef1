// A counting semaphore whose waiter is a callback rather than a thread: wait() registers what to
// do once the semaphore is signalled or a time-out passes, and returns at once. A serial queue
// waits on one by suspending itself (PooledSerialQueue::waitThen), so a wait of seconds for a
// platform service costs a timer, not a parked thread.
//
// Semantics of a counting semaphore made with count 0: each signal() either ends the pending wait
// or, with none pending, raises the count; a wait takes one from the count at once when it is
// above zero. A signal that comes after a wait timed out is not lost: it raises the count.
//
// Thread safety: signal() and wait() may be called from any thread. The object is a handle to
// shared state, so a callback that holds a copy (a platform service's completion, say) may
// signal safely after every other holder is gone.
#pragma once

#include <chrono>
#include <functional>
#include <memory>

namespace qv {

class TaskExecutor;

class AsyncSemaphore {
  public:
    // Called once: true when the semaphore was signalled, false when the time-out passed first.
    using Done = std::function<void(bool signalled)>;

    // executor runs the time-out timers; it must outlive every wait.
    explicit AsyncSemaphore(TaskExecutor& executor);

    // Ends the pending wait (its callback runs on the caller's thread, before signal() returns),
    // or raises the count when no wait is pending.
    void signal() const;

    // Calls done(true) now, on the caller's thread, when the count is above zero (taking one);
    // otherwise done(true) on the thread of the signal that comes first, or done(false) on the
    // executor's thread once timeout has passed from this call. REQUIRES: no other wait pending
    // (callers wait one at a time, as a serial queue does).
    void wait(std::chrono::nanoseconds timeout, Done done) const;

    // Signals not yet taken by a wait. For tests and diagnostics.
    long count() const;
    // Whether a wait is pending.
    bool waiting() const;

  private:
    struct State;
    std::shared_ptr<State> state_;
};

}  // namespace qv
