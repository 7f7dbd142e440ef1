#include "session/RepeatingTimer.h"

namespace qv {

struct RepeatingTimer::State {
    std::mutex mutex;
    std::condition_variable wake;
    bool valid = true;  // guarded by mutex
};

RepeatingTimer::RepeatingTimer(std::chrono::duration<double> interval,
                               std::function<void()> handler)
    : state_(std::make_shared<State>()) {
    const auto step = std::chrono::duration_cast<std::chrono::steady_clock::duration>(interval);
    thread_ = std::thread([state = state_, step, handler = std::move(handler)] {
        auto next = std::chrono::steady_clock::now() + step;
        std::unique_lock lock(state->mutex);
        for (;;) {
            if (state->wake.wait_until(lock, next, [&] { return !state->valid; })) {
                return;
            }
            lock.unlock();
            handler();
            lock.lock();
            next += step;
        }
    });
}

RepeatingTimer::~RepeatingTimer() {
    invalidate();
    if (thread_.get_id() == std::this_thread::get_id()) {
        thread_.detach();  // destroyed from its own handler: the thread ends after the handler
    } else if (thread_.joinable()) {
        thread_.join();
    }
}

void RepeatingTimer::invalidate() {
    {
        std::lock_guard lock(state_->mutex);
        state_->valid = false;
    }
    state_->wake.notify_all();
}

bool RepeatingTimer::isValid() const {
    std::lock_guard lock(state_->mutex);
    return state_->valid;
}

}  // namespace qv
