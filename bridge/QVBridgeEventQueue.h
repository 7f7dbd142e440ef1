// The one place where the PipeWire loop hands work to the thread that talks to the daemon. A push
// never waits: a message that finds the queue full is dropped and counted, so a stalled or absent
// daemon costs at most `capacity` queued messages of memory.
//
// Session operations (open, start, close) are not dropped, or the daemon would keep sessions of
// streams long gone; they stay bounded all the same: a stream that goes away while its open is
// still queued takes every queued event of its session with it, so at most one open and one start
// per live stream and one close per session the sender already holds can be queued.
//
// Thread-safe: any number of pushers, one popper.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <deque>
#include <mutex>
#include <unordered_set>

#include "QVBridgeEvent.h"
#include "QVBridgeStats.h"

namespace qv::bridge {

class QVBridgeEventQueue {
  public:
    static constexpr std::size_t kDefaultCapacity = 4096;

    QVBridgeEventQueue(std::size_t capacity, QVBridgeStats& stats);

    // False when the event was dropped (a message and the queue full) or the queue is closed.
    bool push(QVBridgeEvent event);
    // Waits up to `wait` for an event; false on time-out, or when closed and empty.
    bool pop(QVBridgeEvent& out, std::chrono::milliseconds wait);
    // No more pushes; pop drains what is queued, then answers false at once.
    void close();
    bool closed() const;

    std::size_t size() const;
    std::size_t messages() const;

  private:
    const std::size_t capacity_;
    QVBridgeStats& stats_;
    mutable std::mutex mutex_;
    std::condition_variable ready_;
    std::deque<QVBridgeEvent> events_;        // guarded by mutex_
    std::size_t messages_ = 0;                // guarded by mutex_: kMessage events queued
    std::unordered_set<std::int64_t> opens_;  // guarded by mutex_: sessions opened in the queue
    bool closed_ = false;                     // guarded by mutex_
};

}  // namespace qv::bridge
