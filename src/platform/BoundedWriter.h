// A thread that hands items to a writer function, fed through a bounded buffer. push() never
// waits: an item that finds the buffer full is refused, and the caller counts the loss. Used where
// a slow consumer (the journal, a sink file) must never stall the reporting server queue.
//
// The writer takes either one item at a time or, with kBatches, everything queued at once (a
// sink then writes many lines with one system call when it falls behind). While a batch is being
// written, up to `capacity` further items may queue, so at most twice that is held. Items may
// also be given a size: then the queue holds at most maxBytes of them besides the batch being
// written (one item always fits an empty queue, whatever its size), so a few huge items cannot
// take the memory that many small ones were allowed.
//
// With a linger, the thread woken by an item waits that long for more before it writes, and
// pushes meanwhile do not wake it: under a steady stream the writer wakes once per linger, not
// once per item, which spares the pushing thread a wake-up call each time. A flush, a buffer half
// full or the end cut the linger short.
//
// Thread safety: push(), flush() and flushUntil() may be called from any thread; the writer
// function runs only on the writer's own thread, in push order.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <mutex>
#include <thread>

namespace qv {

template <typename T>
class BoundedWriter {
  public:
    using Batch = std::deque<T>;
    struct Batches {};
    static constexpr Batches kBatches{};

    // The writer takes one item at a time.
    BoundedWriter(std::size_t capacity, std::function<void(T&)> write)
        : BoundedWriter(kBatches, capacity, [write = std::move(write)](Batch& batch) {
              for (T& item : batch) {
                  write(item);
              }
          }) {}
    // The writer takes every item queued, oldest first.
    BoundedWriter(Batches, std::size_t capacity, std::function<void(Batch&)> write)
        : capacity_(capacity), write_(std::move(write)), thread_([this] { run(); }) {}

    BoundedWriter(const BoundedWriter&) = delete;
    BoundedWriter& operator=(const BoundedWriter&) = delete;

    // Writes what is queued, then ends the thread.
    ~BoundedWriter() {
        {
            std::lock_guard lock(mutex_);
            stopping_ = true;
        }
        wake_.notify_all();
        thread_.join();
    }

    // Bounds the bytes queued (see push(item, bytes)); without it, only the count is bounded.
    void setMaxBytes(std::size_t maxBytes) {
        std::lock_guard lock(mutex_);
        maxBytes_ = maxBytes;
    }

    // How long the woken writer waits for more items before it writes (none by default).
    void setLinger(std::chrono::microseconds linger) {
        std::lock_guard lock(mutex_);
        linger_ = linger;
    }

    // Queues the item; false when the buffer is full (the item is dropped). bytes is what the
    // item holds, counted against setMaxBytes().
    bool push(T item, std::size_t bytes = 0) {
        bool wake = false;
        {
            std::lock_guard lock(mutex_);
            if (items_.size() >= capacity_ ||
                (!items_.empty() && queuedBytes_ + bytes > maxBytes_)) {
                return false;
            }
            items_.push_back(std::move(item));
            queuedBytes_ += bytes;
            wake = idle_ || (lingering_ && halfFull());
        }
        if (wake) {
            wake_.notify_one();
        }
        return true;
    }

    // Blocks until everything pushed before this call has been written.
    void flush() {
        std::unique_lock lock(mutex_);
        const std::size_t target = hurry();
        drained_.wait(lock, [&] { return written_ >= target; });
        --flushing_;
    }

    // As flush(), but gives up at deadline; true when everything was written by then.
    bool flushUntil(std::chrono::steady_clock::time_point deadline) {
        std::unique_lock lock(mutex_);
        const std::size_t target = hurry();
        const bool done = drained_.wait_until(lock, deadline, [&] { return written_ >= target; });
        --flushing_;
        return done;
    }

  private:
    // REQUIRES: mutex_ held. A lingering writer writes before pushes start to be refused.
    bool halfFull() const {
        return items_.size() >= capacity_ / 2 || queuedBytes_ >= maxBytes_ / 2;
    }

    // REQUIRES: mutex_ held. Cuts a linger short for a flush; returns how many items must have
    // been written for the flush to be done. The caller decrements flushing_ when it returns.
    std::size_t hurry() {
        ++flushing_;
        if (lingering_) {
            wake_.notify_one();
        }
        return written_ + inFlight_ + items_.size();
    }

    void run() {
        Batch batch;
        std::unique_lock lock(mutex_);
        for (;;) {
            idle_ = true;
            wake_.wait(lock, [&] { return stopping_ || !items_.empty(); });
            idle_ = false;
            if (linger_.count() > 0 && !stopping_ && flushing_ == 0) {
                lingering_ = true;
                wake_.wait_for(lock, linger_,
                               [&] { return stopping_ || flushing_ > 0 || halfFull(); });
                lingering_ = false;
            }
            if (items_.empty()) {
                return;  // stopping and drained
            }
            batch.swap(items_);
            queuedBytes_ = 0;
            inFlight_ = batch.size();
            lock.unlock();
            write_(batch);
            batch.clear();
            lock.lock();
            written_ += inFlight_;
            inFlight_ = 0;
            drained_.notify_all();
        }
    }

    const std::size_t capacity_;
    const std::function<void(Batch&)> write_;
    std::mutex mutex_;
    std::condition_variable wake_;
    std::condition_variable drained_;
    std::deque<T> items_;                  // guarded by mutex_
    std::size_t queuedBytes_ = 0;          // guarded by mutex_
    std::size_t maxBytes_ = SIZE_MAX;      // guarded by mutex_
    std::size_t written_ = 0;              // guarded by mutex_
    std::size_t inFlight_ = 0;             // guarded by mutex_
    bool stopping_ = false;                // guarded by mutex_
    bool idle_ = false;                    // waiting for a first item; guarded by mutex_
    bool lingering_ = false;               // waiting for more items; guarded by mutex_
    int flushing_ = 0;                     // flushes waiting; guarded by mutex_
    std::chrono::microseconds linger_{0};  // guarded by mutex_
    std::thread thread_;                   // last: starts once the members above exist
};

}  // namespace qv
