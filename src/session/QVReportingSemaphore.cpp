#include "session/QVReportingSemaphore.h"

#include <algorithm>
#include <chrono>
#include <cmath>

namespace qv {

void QVReportingSemaphore::signal() {
    {
        std::lock_guard lock(mutex_);
        ++count_;
    }
    nonzero_.notify_one();
}

bool QVReportingSemaphore::wait(double timeoutSeconds) {
    const double seconds = std::isnan(timeoutSeconds) ? 0.0 : std::clamp(timeoutSeconds, 0.0, 1e9);
    const auto deadline = std::chrono::steady_clock::now() +
                          std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                              std::chrono::duration<double>(seconds));
    std::unique_lock lock(mutex_);
    if (!nonzero_.wait_until(lock, deadline, [&] { return count_ > 0; })) {
        return false;
    }
    --count_;
    return true;
}

bool QVReportingSemaphore::tryTake() {
    std::lock_guard lock(mutex_);
    if (count_ == 0) {
        return false;
    }
    --count_;
    return true;
}

}  // namespace qv
