// A serial task queue without a thread of its own: its tasks run one at a time, in the order they
// were posted, on the threads of a shared TaskExecutor. A worker that must carry out slow or
// waiting work in order (the Convo worker, one queue per session) gets one of these, so that the
// daemon can hold thousands of sessions on a pool of two threads.
//
// Waiting. A task that must wait for a platform service (up to seconds) does not block: it calls
// waitThen(), which suspends the queue once the task returns. Tasks posted meanwhile are held, in
// order. When the semaphore is signalled, or the time-out passes, the continuation runs as the
// queue's next task and the held tasks follow it. No thread is parked meanwhile, so a wait never
// holds up other queues, the reporting server queue or the pool; the time-out is a timer of the
// executor, which tests drive with a fake.
//
// Fairness. A queue with a long backlog hands its thread back to the executor after
// kTasksPerTurn tasks, so one session's burst cannot starve the others.
//
// Gathering. A queue may be given a gathering delay for its tryAsync() tasks: an idle queue then
// waits that long (or until kTasksPerTurn tasks are waiting) before it asks the executor for a
// thread, so a steady stream of small tasks wakes the pool once per batch instead of once per
// task. async() tasks and the end of a wait start a turn at once, running whatever was gathered
// before them first: the order never changes.
//
// Memory. tryAsync() refuses a task once `capacity` tasks are waiting; the caller decides what a
// refusal means (the Convo worker drops the message and counts it). async() always takes the
// task: it is for the few control tasks whose number follows the client's calls.
//
// Lifetime. The queue is a handle: tasks that are queued, running or held by a pending wait keep
// the queue's state alive, and run even when the owner has let go of the handle. A task keeps
// alive what it needs by capturing it.
//
// Thread safety: every member may be called from any thread; waitThen() only from a task that is
// running on this queue.
#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <limits>
#include <memory>
#include <string>

namespace qv {

class AsyncSemaphore;
class TaskExecutor;

class PooledSerialQueue {
  public:
    using Task = std::function<void()>;

    static constexpr std::size_t kUnbounded = std::numeric_limits<std::size_t>::max();
    // Tasks a queue runs before it gives its thread back to the executor.
    static constexpr std::size_t kTasksPerTurn = 64;

    // executor must outlive every task of the queue. gatherDelay: see Gathering above (zero: a
    // turn starts as soon as there is a task).
    PooledSerialQueue(std::string label, TaskExecutor& executor, std::size_t capacity = kUnbounded,
                      std::chrono::nanoseconds gatherDelay = std::chrono::nanoseconds(0));

    PooledSerialQueue(const PooledSerialQueue&) = delete;
    PooledSerialQueue& operator=(const PooledSerialQueue&) = delete;

    const std::string& label() const;

    // Posts a task; it runs after every task posted before it.
    void async(Task task);
    // Posts a task unless `capacity` tasks are already waiting; false when refused (the task is
    // destroyed unrun). It may be gathered with the next ones before it runs.
    bool tryAsync(Task task);

    // From a task running on this queue: once that task returns, the queue runs nothing until the
    // semaphore is signalled or timeout has passed (measured from this call); then
    // then(signalled) runs as the queue's next task, ahead of every task posted meanwhile.
    void waitThen(const AsyncSemaphore& semaphore, std::chrono::nanoseconds timeout,
                  std::function<void(bool signalled)> then);

    // Whether the caller is a task running on this queue.
    bool isCurrent() const;
    // Tasks posted and not yet started (a held continuation included).
    std::size_t pendingCount() const;
    // Whether the queue is suspended in a wait.
    bool isWaiting() const;

  private:
    struct State;
    std::shared_ptr<State> state_;
};

}  // namespace qv
