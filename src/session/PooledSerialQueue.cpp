#include "session/PooledSerialQueue.h"

#include <cstdint>
#include <deque>
#include <mutex>

#include "platform/TaskExecutor.h"
#include "session/AsyncSemaphore.h"

namespace qv {

struct PooledSerialQueue::State : std::enable_shared_from_this<State> {
    State(std::string l, TaskExecutor& e, std::size_t c, std::chrono::nanoseconds d)
        : label(std::move(l)), executor(e), capacity(c), gatherDelay(d) {}

    // Queues task, unless bounded and full. Schedules a turn on the executor when the queue is
    // neither running nor suspended: at once when urgent (or without a gathering delay), else
    // once gatherDelay has passed or a turn's worth of tasks is waiting, whichever comes first.
    bool enqueue(Task task, bool bounded, bool urgent);
    // Lifts the suspension with the continuation as the next task.
    void resume(Task next);
    // One turn on an executor thread.
    void drain();
    void post() {
        executor.execute([self = shared_from_this()] { self->drain(); });
    }
    // Sets a timer that starts a turn unless one was started meanwhile (by generation).
    void arm(std::uint64_t generation) {
        executor.schedule(gatherDelay, [self = shared_from_this(), generation] {
            {
                std::lock_guard lock(self->mutex);
                if (!self->gathering || self->gatherGeneration != generation) {
                    return;  // a turn was started before the delay ran out
                }
                self->gathering = false;
                self->scheduled = true;
            }
            self->drain();
        });
    }

    const std::string label;
    TaskExecutor& executor;
    const std::size_t capacity;
    const std::chrono::nanoseconds gatherDelay;
    mutable std::mutex mutex;
    std::deque<Task> tasks;              // guarded by mutex
    Task next;                           // guarded by mutex; a wait's continuation, run first
    bool scheduled = false;              // guarded by mutex; a turn is posted or running
    bool suspended = false;              // guarded by mutex; a wait is pending
    bool gathering = false;              // guarded by mutex; a timer will start the next turn
    std::uint64_t gatherGeneration = 0;  // guarded by mutex; numbers the gathering timers
};

namespace {

// The state of the queue whose task the current thread is running.
thread_local const void* tCurrent = nullptr;

}  // namespace

bool PooledSerialQueue::State::enqueue(Task task, bool bounded, bool urgent) {
    bool start = false;
    std::uint64_t armGeneration = 0;
    {
        std::lock_guard lock(mutex);
        if (bounded && tasks.size() >= capacity) {
            return false;
        }
        tasks.push_back(std::move(task));
        if (!scheduled && !suspended) {
            if (urgent || gatherDelay.count() <= 0 || tasks.size() >= kTasksPerTurn) {
                start = true;
                scheduled = true;
                gathering = false;  // a timer still pending finds its generation stale
            } else if (!gathering) {
                gathering = true;
                armGeneration = ++gatherGeneration;
            }
        }
    }
    if (start) {
        post();
    } else if (armGeneration != 0) {
        arm(armGeneration);
    }
    return true;
}

void PooledSerialQueue::State::resume(Task continuation) {
    bool start;
    {
        std::lock_guard lock(mutex);
        next = std::move(continuation);
        suspended = false;
        // A wait that ends inside waitThen() finds its own turn still running.
        start = !scheduled;
        scheduled = true;
        gathering = false;
    }
    if (start) {
        post();
    }
}

void PooledSerialQueue::State::drain() {
    const void* const outer = tCurrent;
    tCurrent = this;
    for (std::size_t ran = 0;; ++ran) {
        Task task;
        {
            std::lock_guard lock(mutex);
            if (suspended || (!next && tasks.empty())) {
                scheduled = false;
                break;
            }
            if (ran == kTasksPerTurn) {
                // Give the thread back; the rest waits for the next turn.
                tCurrent = outer;
                post();
                return;
            }
            if (next) {
                task = std::move(next);
                next = nullptr;
            } else {
                task = std::move(tasks.front());
                tasks.pop_front();
            }
        }
        task();
        task = nullptr;  // what the task captured goes before the next one starts
    }
    tCurrent = outer;
}

PooledSerialQueue::PooledSerialQueue(std::string label, TaskExecutor& executor,
                                     std::size_t capacity, std::chrono::nanoseconds gatherDelay)
    : state_(std::make_shared<State>(std::move(label), executor, capacity, gatherDelay)) {}

const std::string& PooledSerialQueue::label() const {
    return state_->label;
}

void PooledSerialQueue::async(Task task) {
    state_->enqueue(std::move(task), /*bounded=*/false, /*urgent=*/true);
}

bool PooledSerialQueue::tryAsync(Task task) {
    return state_->enqueue(std::move(task), /*bounded=*/true, /*urgent=*/false);
}

void PooledSerialQueue::waitThen(const AsyncSemaphore& semaphore, std::chrono::nanoseconds timeout,
                                 std::function<void(bool signalled)> then) {
    {
        std::lock_guard lock(state_->mutex);
        state_->suspended = true;
    }
    semaphore.wait(timeout, [state = state_, then = std::move(then)](bool signalled) mutable {
        state->resume([then = std::move(then), signalled] { then(signalled); });
    });
}

bool PooledSerialQueue::isCurrent() const {
    return tCurrent == state_.get();
}

std::size_t PooledSerialQueue::pendingCount() const {
    std::lock_guard lock(state_->mutex);
    return state_->tasks.size() + (state_->next ? 1 : 0);
}

bool PooledSerialQueue::isWaiting() const {
    std::lock_guard lock(state_->mutex);
    return state_->suspended;
}

}  // namespace qv
