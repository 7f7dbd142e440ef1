// A bounded wait for a flag, and its signal. A worker that asks a platform service for something
// waits here, with a time-out, for the service's callback (on another thread) to signal.
#pragma once

#include <condition_variable>
#include <mutex>
#include <string_view>

#include "session/QVReportingLog.h"

namespace qv {

// The lockable condition a wait and its signal share.
struct QVReportingCondition {
    std::mutex mutex;
    std::condition_variable condition;
};

// Waits until *flag is set, logging waitingMessage at each pass; the time-out restarts whenever
// the wait wakes without the flag. Returns true when the flag was seen set (it stays set), false
// after logging timeoutMessage at error level.
bool QVReportingUtilityWait(QVReportingCondition& condition, double timeoutSeconds, bool* flag,
                            std::string_view waitingMessage, std::string_view timeoutMessage,
                            const QVReportingLogCategory& logCategory);

// Sets *flag and wakes one waiter.
void QVReportingUtilitySignal(QVReportingCondition& condition, bool* flag);

}  // namespace qv
