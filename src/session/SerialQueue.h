// A serial task queue: one thread runs the tasks one at a time, in the order they were posted.
// All client work, and all session and worker state, lives on the reporting server queue
// (QVReportingUtilityGetReportingServerQueue), so none of it needs a lock.
//
// Thread safety: async(), sync() and isCurrent() may be called from any thread. sync() from the
// queue's own thread runs the task at once instead of waiting on itself.
#pragma once

#include <condition_variable>
#include <deque>
#include <functional>
#include <mutex>
#include <string>
#include <thread>

namespace qv {

class SerialQueue {
  public:
    explicit SerialQueue(std::string label);
    // Runs what was posted before, then ends the thread.
    ~SerialQueue();

    SerialQueue(const SerialQueue&) = delete;
    SerialQueue& operator=(const SerialQueue&) = delete;

    const std::string& label() const { return label_; }

    // Posts a task; it runs after every task posted before it.
    void async(std::function<void()> task);
    // Posts a task and waits until it has run.
    void sync(const std::function<void()>& task);
    // Whether the caller is running on this queue's thread.
    bool isCurrent() const { return std::this_thread::get_id() == threadId_; }

  private:
    void run();

    const std::string label_;
    std::mutex mutex_;
    std::condition_variable wake_;
    std::deque<std::function<void()>> tasks_;  // guarded by mutex_
    bool stopping_ = false;                    // guarded by mutex_
    std::thread thread_;
    std::thread::id threadId_;
};

// The one queue of client work, "com.korvane.qvsound.reporting.server", made on first use and
// kept for the life of the process.
SerialQueue& QVReportingUtilityGetReportingServerQueue();

}  // namespace qv
