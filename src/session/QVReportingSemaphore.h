// A counting semaphore with a bounded wait: a worker that asks a platform service for something
// waits here for the service's callback (on another thread) to signal. Signals are counted, so a
// signal that comes before the wait, or after a wait that timed out, is taken by the next wait.
//
// wait() is virtual so that tests can put a fake clock behind the time-out instead of sleeping.
//
// Thread safety: signal() and wait() may be called from any thread.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <mutex>

namespace qv {

class QVReportingSemaphore {
  public:
    explicit QVReportingSemaphore(std::uint64_t initial = 0) : count_(initial) {}
    virtual ~QVReportingSemaphore() = default;

    QVReportingSemaphore(const QVReportingSemaphore&) = delete;
    QVReportingSemaphore& operator=(const QVReportingSemaphore&) = delete;

    // Adds one to the count and wakes one waiter.
    void signal();
    // Takes one from the count, waiting at most timeoutSeconds for it to be nonzero; false on a
    // time-out. A NaN or negative time-out does not wait; a huge one is capped.
    virtual bool wait(double timeoutSeconds);

  protected:
    // Takes one if the count is nonzero, without waiting.
    bool tryTake();

  private:
    std::mutex mutex_;
    std::condition_variable nonzero_;
    std::uint64_t count_;  // guarded by mutex_
};

}  // namespace qv
