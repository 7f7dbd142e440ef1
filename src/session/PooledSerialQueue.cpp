#include "session/PooledSerialQueue.h"

#include <deque>
#include <mutex>

#include "platform/TaskExecutor.h"
#include "session/AsyncSemaphore.h"

namespace qv {

struct PooledSerialQueue::State : std::enable_shared_from_this<State> {
    State(std::string l, TaskExecutor& e, std::size_t c)
        : label(std::move(l)), executor(e), capacity(c) {}

    // Queues task (ahead of the others when first), unless bounded and full; schedules a turn on
    // the executor when the queue is neither running nor suspended.
    bool enqueue(Task task, bool bounded);
    // Lifts the suspension with the continuation as the next task.
    void resume(Task next);
    // One turn on an executor thread.
    void drain();
    void post() {
        executor.execute([self = shared_from_this()] { self->drain(); });
    }

    const std::string label;
    TaskExecutor& executor;
    const std::size_t capacity;
    mutable std::mutex mutex;
    std::deque<Task> tasks;  // guarded by mutex
    Task next;               // guarded by mutex; a wait's continuation, run before tasks
    bool scheduled = false;  // guarded by mutex; a turn is posted or running
    bool suspended = false;  // guarded by mutex; a wait is pending
};

namespace {

// The state of the queue whose task the current thread is running.
thread_local const void* tCurrent = nullptr;

}  // namespace

bool PooledSerialQueue::State::enqueue(Task task, bool bounded) {
    bool start;
    {
        std::lock_guard lock(mutex);
        if (bounded && tasks.size() >= capacity) {
            return false;
        }
        tasks.push_back(std::move(task));
        start = !scheduled && !suspended;
        scheduled = scheduled || start;
    }
    if (start) {
        post();
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
                                     std::size_t capacity)
    : state_(std::make_shared<State>(std::move(label), executor, capacity)) {}

const std::string& PooledSerialQueue::label() const {
    return state_->label;
}

void PooledSerialQueue::async(Task task) {
    state_->enqueue(std::move(task), /*bounded=*/false);
}

bool PooledSerialQueue::tryAsync(Task task) {
    return state_->enqueue(std::move(task), /*bounded=*/true);
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
