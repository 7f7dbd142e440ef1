#include "session/AsyncSemaphore.h"

#include <cstdint>
#include <mutex>

#include "platform/TaskExecutor.h"

namespace qv {

struct AsyncSemaphore::State {
    explicit State(TaskExecutor& e) : executor(e) {}

    TaskExecutor& executor;
    mutable std::mutex mutex;
    long count = 0;                   // guarded by mutex
    Done waiter;                      // guarded by mutex; set while a wait is pending
    std::uint64_t generation = 0;     // guarded by mutex; numbers the waits
    TaskExecutor::TimerID timer = 0;  // guarded by mutex; the pending wait's time-out
};

AsyncSemaphore::AsyncSemaphore(TaskExecutor& executor)
    : state_(std::make_shared<State>(executor)) {}

void AsyncSemaphore::signal() const {
    Done waiter;
    TaskExecutor::TimerID timer = 0;
    {
        std::lock_guard lock(state_->mutex);
        if (!state_->waiter) {
            ++state_->count;
            return;
        }
        waiter = std::move(state_->waiter);
        state_->waiter = nullptr;
        timer = state_->timer;
        state_->timer = 0;
    }
    // The waiter first, then the timer: whoever waits for the executor to fall idle never sees a
    // gap between the end of the wait and the work it starts.
    waiter(true);
    if (timer != 0) {
        state_->executor.cancel(timer);
    }
}

void AsyncSemaphore::wait(std::chrono::nanoseconds timeout, Done done) const {
    std::uint64_t generation = 0;
    bool taken = false;
    {
        std::lock_guard lock(state_->mutex);
        if (state_->count > 0) {
            --state_->count;
            taken = true;
        } else {
            state_->waiter = std::move(done);
            generation = ++state_->generation;
        }
    }
    if (taken) {
        done(true);
        return;
    }
    const TaskExecutor::TimerID timer =
        state_->executor.schedule(timeout, [state = state_, generation] {
            Done waiter;
            {
                std::lock_guard lock(state->mutex);
                // A signal may have ended this wait, and another wait begun, since the timer was
                // set: only the wait it was set for times out.
                if (!state->waiter || state->generation != generation) {
                    return;
                }
                waiter = std::move(state->waiter);
                state->waiter = nullptr;
                state->timer = 0;
            }
            waiter(false);
        });
    bool stale = false;
    {
        std::lock_guard lock(state_->mutex);
        if (state_->waiter && state_->generation == generation) {
            state_->timer = timer;
        } else {
            stale = true;  // signalled before the timer's ID was known
        }
    }
    if (stale) {
        state_->executor.cancel(timer);
    }
}

long AsyncSemaphore::count() const {
    std::lock_guard lock(state_->mutex);
    return state_->count;
}

bool AsyncSemaphore::waiting() const {
    std::lock_guard lock(state_->mutex);
    return static_cast<bool>(state_->waiter);
}

}  // namespace qv
