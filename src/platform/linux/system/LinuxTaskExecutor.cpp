#include "platform/linux/system/LinuxTaskExecutor.h"

#include "platform/linux/system/ThreadPriority.h"

#include <pthread.h>
#include <unistd.h>

#include <cerrno>

namespace qv {

LinuxTaskExecutor::LinuxTaskExecutor(std::size_t threads, std::string name) {
    if (threads == 0) {
        threads = 1;
    }
    if (name.size() > 12) {
        name.resize(12);
    }
    threads_.reserve(threads);
    for (std::size_t i = 0; i < threads; ++i) {
        threads_.emplace_back([this, threadName = name + "-" + std::to_string(i % 100)] {
            pthread_setname_np(pthread_self(), threadName.c_str());
            QVReportingLowerOwnThreadPriority(kBackgroundNiceness);
            run();
        });
    }
}

LinuxTaskExecutor::~LinuxTaskExecutor() {
    {
        std::lock_guard lock(mutex_);
        stopping_ = true;
    }
    wake_.notify_all();
    for (auto& t : threads_) {
        t.join();
    }
    // Destroyed outside the lock: what a task holds may, as it goes, hand the executor more work.
    std::map<TimerKey, Task> timers;
    std::deque<Task> tasks;
    {
        std::lock_guard lock(mutex_);
        timers.swap(timers_);
        tasks.swap(tasks_);
        timerDue_.clear();
    }
}

void LinuxTaskExecutor::execute(Task task) {
    {
        std::lock_guard lock(mutex_);
        tasks_.push_back(std::move(task));
    }
    wake_.notify_one();
}

TaskExecutor::TimerID LinuxTaskExecutor::schedule(std::chrono::nanoseconds delay, Task task) {
    const TimePoint due = std::chrono::steady_clock::now() +
                          std::chrono::duration_cast<std::chrono::steady_clock::duration>(delay);
    TimerID id;
    bool earliest;
    {
        std::lock_guard lock(mutex_);
        id = nextTimer_++;
        timers_.emplace(TimerKey{due, id}, std::move(task));
        timerDue_.emplace(id, due);
        earliest = timers_.begin()->first.second == id;
    }
    // A new earliest timer shortens the wait of every idle thread, not just of one.
    if (earliest) {
        wake_.notify_all();
    }
    return id;
}

bool LinuxTaskExecutor::cancel(TimerID id) {
    Task dropped;  // destroyed after the lock is released
    {
        std::lock_guard lock(mutex_);
        const auto due = timerDue_.find(id);
        if (due == timerDue_.end()) {
            return false;
        }
        auto node = timers_.extract(TimerKey{due->second, id});
        timerDue_.erase(due);
        dropped = std::move(node.mapped());
        if (idleLocked()) {
            idle_.notify_all();
        }
    }
    return true;
}

bool LinuxTaskExecutor::waitUntilIdle(std::chrono::nanoseconds timeout) {
    std::unique_lock lock(mutex_);
    return idle_.wait_for(lock, timeout, [this] { return idleLocked(); });
}

void LinuxTaskExecutor::run() {
    std::unique_lock lock(mutex_);
    for (;;) {
        Task task;
        if (!stopping_ && !timers_.empty() &&
            timers_.begin()->first.first <= std::chrono::steady_clock::now()) {
            auto node = timers_.extract(timers_.begin());
            timerDue_.erase(node.key().second);
            task = std::move(node.mapped());
        } else if (!tasks_.empty()) {
            task = std::move(tasks_.front());
            tasks_.pop_front();
        } else if (stopping_) {
            return;
        } else if (timers_.empty()) {
            wake_.wait(lock);
            continue;
        } else {
            // A copy: the timer may be cancelled, and its node freed, while this thread waits.
            const TimePoint due = timers_.begin()->first.first;
            wake_.wait_until(lock, due);
            continue;
        }
        ++running_;
        lock.unlock();
        task();
        task = nullptr;  // what the task captured goes before the next one starts
        lock.lock();
        --running_;
        if (idleLocked()) {
            idle_.notify_all();
        }
    }
}

}  // namespace qv
