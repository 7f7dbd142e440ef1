#include "QVBridgeEventQueue.h"

#include <algorithm>

namespace qv::bridge {

QVBridgeEventQueue::QVBridgeEventQueue(std::size_t capacity, QVBridgeStats& stats)
    : capacity_(capacity), stats_(stats) {}

bool QVBridgeEventQueue::push(QVBridgeEvent event) {
    {
        std::lock_guard lock(mutex_);
        if (closed_) {
            return false;
        }
        switch (event.kind) {
            case QVBridgeEvent::Kind::kMessage:
                if (messages_ >= capacity_) {
                    stats_.noteEventDropped();
                    return false;
                }
                ++messages_;
                break;
            case QVBridgeEvent::Kind::kOpen:
                opens_.insert(event.reporterID);
                break;
            case QVBridgeEvent::Kind::kClose:
                // The sender never saw this session: forget it here instead of making it there.
                if (opens_.erase(event.reporterID) != 0) {
                    const auto id = event.reporterID;
                    const auto mine = [id](const QVBridgeEvent& e) { return e.reporterID == id; };
                    // Counted before removal: remove_if leaves moved-from events behind.
                    messages_ -= static_cast<std::size_t>(
                        std::count_if(events_.begin(), events_.end(), [&](const QVBridgeEvent& e) {
                            return mine(e) && e.kind == QVBridgeEvent::Kind::kMessage;
                        }));
                    const auto gone = std::remove_if(events_.begin(), events_.end(), mine);
                    events_.erase(gone, events_.end());
                    return true;
                }
                break;
            case QVBridgeEvent::Kind::kStart:
                break;
        }
        events_.push_back(std::move(event));
    }
    ready_.notify_one();
    return true;
}

bool QVBridgeEventQueue::pop(QVBridgeEvent& out, std::chrono::milliseconds wait) {
    std::unique_lock lock(mutex_);
    if (!ready_.wait_for(lock, wait, [this] { return !events_.empty() || closed_; })) {
        return false;
    }
    if (events_.empty()) {
        return false;
    }
    out = std::move(events_.front());
    events_.pop_front();
    if (out.kind == QVBridgeEvent::Kind::kMessage) {
        --messages_;
    } else if (out.kind == QVBridgeEvent::Kind::kOpen) {
        opens_.erase(out.reporterID);
    }
    return true;
}

void QVBridgeEventQueue::close() {
    {
        std::lock_guard lock(mutex_);
        closed_ = true;
    }
    ready_.notify_all();
}

bool QVBridgeEventQueue::closed() const {
    std::lock_guard lock(mutex_);
    return closed_;
}

std::size_t QVBridgeEventQueue::size() const {
    std::lock_guard lock(mutex_);
    return events_.size();
}

std::size_t QVBridgeEventQueue::messages() const {
    std::lock_guard lock(mutex_);
    return messages_;
}

}  // namespace qv::bridge
