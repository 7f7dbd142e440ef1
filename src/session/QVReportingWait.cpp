#include "session/QVReportingWait.h"

#include <algorithm>
#include <chrono>
#include <cmath>

namespace qv {

bool QVReportingUtilityWait(QVReportingCondition& condition, double timeoutSeconds, bool* flag,
                            std::string_view waitingMessage, std::string_view timeoutMessage,
                            const QVReportingLogCategory& logCategory) {
    std::unique_lock lock(condition.mutex);
    // A NaN or negative time-out waits not at all; a huge one is capped to stay representable.
    const double seconds = std::isnan(timeoutSeconds) ? 0.0 : std::clamp(timeoutSeconds, 0.0, 1e9);
    while (!*flag) {
        QVLOG_INFO(logCategory, "{}", waitingMessage);
        const auto deadline = std::chrono::steady_clock::now() +
                              std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                                  std::chrono::duration<double>(seconds));
        // A signal that lands exactly at the deadline still counts.
        if (condition.condition.wait_until(lock, deadline) == std::cv_status::timeout && !*flag) {
            QVLOG_ERROR(logCategory, "{}", timeoutMessage);
            return false;
        }
        QVLOG_INFO(logCategory, "continuing");
    }
    return true;
}

void QVReportingUtilitySignal(QVReportingCondition& condition, bool* flag) {
    std::lock_guard lock(condition.mutex);
    *flag = true;
    condition.condition.notify_one();
}

}  // namespace qv
