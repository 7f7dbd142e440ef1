#include "session/SerialQueue.h"

#include <pthread.h>

#include <future>

namespace qv {

SerialQueue::SerialQueue(std::string label) : label_(std::move(label)) {
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

void SerialQueue::async(std::function<void()> task) {
    {
        std::lock_guard lock(mutex_);
        tasks_.push_back(std::move(task));
    }
    wake_.notify_one();
}

void SerialQueue::sync(const std::function<void()>& task) {
    if (isCurrent()) {
        task();
        return;
    }
    std::promise<void> done;
    async([&] {
        task();
        done.set_value();
    });
    done.get_future().wait();
}

void SerialQueue::run() {
    std::unique_lock lock(mutex_);
    for (;;) {
        wake_.wait(lock, [&] { return stopping_ || !tasks_.empty(); });
        if (tasks_.empty()) {
            return;
        }
        auto task = std::move(tasks_.front());
        tasks_.pop_front();
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
