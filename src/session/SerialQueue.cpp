#include "session/SerialQueue.h"

#include <pthread.h>

#include <algorithm>
#include <future>

namespace qv {

SerialQueue::SerialQueue(std::string label)
    : label_(std::move(label)), ownLane_(std::make_shared<LaneState>()) {
    std::promise<std::thread::id> started;
    auto id = started.get_future();
    thread_ = std::thread([this, &started] {
        started.set_value(std::this_thread::get_id());
        run();
    });
    threadId_ = id.get();
    // Thread names are limited to 15 characters; the tail of the label is the telling part.
    const std::string name = label_.size() > 15 ? label_.substr(label_.size() - 15) : label_;
    pthread_setname_np(thread_.native_handle(), name.c_str());
}

SerialQueue::~SerialQueue() {
    {
        std::lock_guard lock(mutex_);
        stopping_ = true;
    }
    wake_.notify_one();
    if (thread_.joinable()) {
        thread_.join();
    }
}

SerialQueue::Lane SerialQueue::makeLane() {
    return Lane(std::make_shared<LaneState>());
}

void SerialQueue::async(std::function<void()> task) {
    async(ownLane_, std::move(task));
}

void SerialQueue::async(const Lane& lane, std::function<void()> task) {
    {
        std::lock_guard lock(mutex_);
        lane.state_->tasks.push_back({nextSeq_++, std::move(task)});
        if (!lane.state_->ready) {
            lane.state_->ready = true;
            ready_.push_back(lane.state_);
        }
    }
    for (WakeBatch* batch = batch_; batch; batch = batch->outer_) {
        if (&batch->queue_ == this) {
            // The batch's first task wakes the queue at once, so that it works while the rest
            // of the burst is still being posted; the others ride on that wake-up and the one
            // at the batch's end.
            if (batch->posted_) {
                return;
            }
            batch->posted_ = true;
            break;
        }
    }
    wake_.notify_one();
}

thread_local SerialQueue::WakeBatch* SerialQueue::batch_ = nullptr;

SerialQueue::WakeBatch::WakeBatch(SerialQueue& queue) : queue_(queue), outer_(batch_) {
    batch_ = this;
}

SerialQueue::WakeBatch::~WakeBatch() {
    batch_ = outer_;
    if (posted_) {
        queue_.wake_.notify_one();
    }
}

void SerialQueue::sync(const std::function<void()>& task) {
    if (isCurrent()) {
        task();
        return;
    }
    std::promise<void> done;
    {
        std::lock_guard lock(mutex_);
        barriers_.push_back({nextSeq_++, [&] {
                                 task();
                                 done.set_value();
                             }});
    }
    wake_.notify_one();
    done.get_future().wait();
}

bool SerialQueue::barrierDue() const {
    if (barriers_.empty()) {
        return false;
    }
    const std::uint64_t barrier = barriers_.front().seq;
    // Each lane runs in order, so its first task is its oldest.
    return std::none_of(ready_.begin(), ready_.end(),
                        [&](const auto& lane) { return lane->tasks.front().seq < barrier; });
}

void SerialQueue::run() {
    std::unique_lock lock(mutex_);
    for (;;) {
        wake_.wait(lock, [&] { return stopping_ || !ready_.empty() || !barriers_.empty(); });
        std::function<void()> task;
        if (barrierDue()) {
            task = std::move(barriers_.front().run);
            barriers_.pop_front();
        } else if (!ready_.empty()) {
            // One task of the lane whose turn it is; the lane goes to the back of the line while
            // it has more.
            auto lane = std::move(ready_.front());
            ready_.pop_front();
            task = std::move(lane->tasks.front().run);
            lane->tasks.pop_front();
            if (lane->tasks.empty()) {
                lane->ready = false;
            } else {
                ready_.push_back(std::move(lane));
            }
        } else {
            return;  // stopping, and nothing is left
        }
        lock.unlock();
        task();
        task = nullptr;  // drop what the task captured before taking the lock again
        lock.lock();
    }
}

SerialQueue& QVReportingUtilityGetReportingServerQueue() {
    // Never destroyed: tasks may still be posted while the process exits.
    static SerialQueue* const queue = new SerialQueue("com.korvane.qvsound.reporting.server");
    return *queue;
}

}  // namespace qv
