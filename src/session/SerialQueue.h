// A serial task queue: one thread runs the tasks one at a time. All client work, and all session
// and worker state, lives on the reporting server queue
// (QVReportingUtilityGetReportingServerQueue), so none of it needs a lock.
//
// Tasks are posted through lanes. The tasks of one lane run in the order they were posted; lanes
// that have work take turns, one task each, so that a lane with a long backlog (a client flooding
// the daemon) holds up another lane's next task by at most one task of its own. The queue has a
// lane of its own for tasks posted without one. sync() is a barrier across lanes: its task runs
// once every task posted before it, on any lane, has run.
//
// Thread safety: async(), sync(), makeLane() and isCurrent() may be called from any thread.
// sync() from the queue's own thread runs the task at once instead of waiting on itself.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

namespace qv {

class SerialQueue {
    struct LaneState;

  public:
    // A handle on one lane; copies name the same lane. A lane lives while a handle or a task of
    // it does.
    class Lane {
      public:
        Lane() = default;

      private:
        friend class SerialQueue;
        explicit Lane(std::shared_ptr<LaneState> state) : state_(std::move(state)) {}
        std::shared_ptr<LaneState> state_;
    };

    // Wakes the queue for the first task this thread posts to it while it lives, holds back the
    // wake-ups of the later ones, and wakes the queue again at its end if any were posted: a
    // thread that posts a burst (the bus thread reading a run of calls) then costs the queue two
    // wake-ups instead of one a task, and the queue starts on the burst without waiting for its
    // end. Scopes nest. Only the thread that made it may post under it.
    class WakeBatch {
      public:
        explicit WakeBatch(SerialQueue& queue);
        ~WakeBatch();
        WakeBatch(const WakeBatch&) = delete;
        WakeBatch& operator=(const WakeBatch&) = delete;

      private:
        friend class SerialQueue;
        SerialQueue& queue_;
        WakeBatch* const outer_;
        bool posted_ = false;
    };

    explicit SerialQueue(std::string label);
    // Runs what was posted before, then ends the thread.
    ~SerialQueue();

    SerialQueue(const SerialQueue&) = delete;
    SerialQueue& operator=(const SerialQueue&) = delete;

    const std::string& label() const { return label_; }

    Lane makeLane();
    // Posts a task on the queue's own lane; it runs after every task posted before it there.
    void async(std::function<void()> task);
    // Posts a task on a lane (one of this queue's); it runs after every task posted before it on
    // that lane.
    void async(const Lane& lane, std::function<void()> task);
    // Runs a task on the queue once every task posted before it (on any lane) has run, and
    // waits until it has.
    void sync(const std::function<void()>& task);
    // Whether the caller is running on this queue's thread.
    bool isCurrent() const { return std::this_thread::get_id() == threadId_; }

  private:
    struct Task {
        std::uint64_t seq;  // order of posting, across lanes
        std::function<void()> run;
    };
    struct LaneState {
        std::deque<Task> tasks;  // guarded by the queue's mutex_
        bool ready = false;      // listed in ready_; guarded by mutex_
    };

    void run();
    // Whether the first barrier may run: no task posted before it is left. REQUIRES: mutex_ held.
    bool barrierDue() const;

    const std::string label_;
    const Lane ownLane_;
    std::mutex mutex_;
    std::condition_variable wake_;
    // Lanes with tasks, in turn order.
    std::deque<std::shared_ptr<LaneState>> ready_;  // guarded by mutex_
    std::deque<Task> barriers_;                     // guarded by mutex_
    std::uint64_t nextSeq_ = 0;                     // guarded by mutex_
    bool stopping_ = false;                         // guarded by mutex_
    std::thread thread_;
    std::thread::id threadId_;
    static thread_local WakeBatch* batch_;  // the innermost WakeBatch of this thread
};

// The one queue of client work, "com.korvane.qvsound.reporting.server", made on first use and
// kept for the life of the process.
SerialQueue& QVReportingUtilityGetReportingServerQueue();

}  // namespace qv
