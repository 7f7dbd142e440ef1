#include "session/QVReportingStats.h"

#include <algorithm>

namespace qv {

namespace {

constexpr std::string_view kLimitNames[] = {"payload_bytes",
                                            "payload_values",
                                            "payload_depth",
                                            "reporter_ids",
                                            "sessions_per_client",
                                            "clients",
                                            "call_bytes_per_client",
                                            "held_calls_per_client",
                                            "held_calls",
                                            "payload_rate_per_client",
                                            "direct_replies_unread"};

void raiseMax(std::atomic<std::uint64_t>& max, std::uint64_t value) {
    std::uint64_t seen = max.load();
    while (seen < value && !max.compare_exchange_weak(seen, value)) {
    }
}

}  // namespace

QVReportingStats& QVReportingStats::shared() {
    static QVReportingStats stats;
    return stats;
}

void QVReportingStats::noteLimitExceeded(Limit limit) {
    limitsExceeded_[static_cast<std::size_t>(limit)].fetch_add(1, std::memory_order_relaxed);
}

void QVReportingStats::noteInputRefused() {
    inputRefused_.fetch_add(1, std::memory_order_relaxed);
}

void QVReportingStats::noteLogLineDropped() {
    logLinesDropped_.fetch_add(1, std::memory_order_relaxed);
}

void QVReportingStats::noteSinkLineLost(std::string_view sink) {
    std::lock_guard lock(mutex_);
    auto it = sinkLinesLost_.find(sink);
    if (it == sinkLinesLost_.end()) {
        if (sinkLinesLost_.size() >= kMaxTrackedSinks) {
            sink = "other";
        }
        it = sinkLinesLost_.emplace(std::string(sink), 0).first;
    }
    ++it->second;
}

void QVReportingStats::noteSinkTornLineRemoved() {
    sinkTornLinesRemoved_.fetch_add(1, std::memory_order_relaxed);
}

void QVReportingStats::noteIssueCaptureRefused(std::string_view reason) {
    std::lock_guard lock(mutex_);
    auto it = issueCaptureRefused_.find(reason);
    if (it == issueCaptureRefused_.end()) {
        // Reasons are the service's few error codes; a stranger one is pooled.
        if (issueCaptureRefused_.size() >= kMaxTrackedSinks) {
            reason = "other";
        }
        it = issueCaptureRefused_.emplace(std::string(reason), 0).first;
    }
    ++it->second;
}

// --- Files on disk ---

void QVReportingStats::noteSinkBytesExpired(std::string_view sink, std::uint64_t bytes) {
    std::lock_guard lock(mutex_);
    const std::string key = "sink_bytes_expired_" + std::string(sink);
    auto it = bytesExpired_.find(key);
    if (it == bytesExpired_.end()) {
        it = bytesExpired_
                 .emplace(
                     bytesExpired_.size() < 2 * kMaxTrackedSinks ? key : "sink_bytes_expired_other",
                     0)
                 .first;
    }
    it->second += bytes;
}

void QVReportingStats::noteLogBytesExpired(std::string_view dir, std::uint64_t bytes) {
    std::lock_guard lock(mutex_);
    bytesExpired_["log_bytes_expired_" + std::string(dir)] += bytes;
}

void QVReportingStats::noteFileRefused() {
    filesRefused_.fetch_add(1, std::memory_order_relaxed);
}

std::uint64_t QVReportingStats::sinkBytesExpired(std::string_view sink) const {
    std::lock_guard lock(mutex_);
    auto it = bytesExpired_.find("sink_bytes_expired_" + std::string(sink));
    return it == bytesExpired_.end() ? 0 : it->second;
}

void QVReportingStats::noteClientCount(std::size_t clients) {
    clients_.store(clients);
    raiseMax(clientsMax_, clients);
}

void QVReportingStats::noteSessionCount(std::size_t sessions) {
    sessions_.store(sessions);
    raiseMax(sessionsMax_, sessions);
}

void QVReportingStats::setStoreBudgets(std::size_t perSession, std::size_t total) {
    sessionStoreBudget_.store(perSession);
    storeBudget_.store(total);
}

bool QVReportingStats::reserveStoreBytes(std::size_t sessionBytes, std::size_t bytes) {
    if (sessionBytes + bytes > sessionStoreBudget_.load(std::memory_order_relaxed)) {
        return false;
    }
    const std::uint64_t budget = storeBudget_.load(std::memory_order_relaxed);
    std::uint64_t taken = storeBytes_.load(std::memory_order_relaxed);
    do {
        if (taken + bytes > budget) {
            return false;
        }
    } while (!storeBytes_.compare_exchange_weak(taken, taken + bytes, std::memory_order_relaxed));
    raiseMax(storeBytesMax_, taken + bytes);
    return true;
}

void QVReportingStats::forceStoreBytes(std::size_t bytes) {
    raiseMax(storeBytesMax_, storeBytes_.fetch_add(bytes, std::memory_order_relaxed) + bytes);
}

void QVReportingStats::releaseStoreBytes(std::size_t bytes) {
    storeBytes_.fetch_sub(bytes, std::memory_order_relaxed);
}

void QVReportingStats::noteMessageNotStored() {
    messagesNotStored_.fetch_add(1, std::memory_order_relaxed);
}

void QVReportingStats::notePreviousValueDropped() {
    previousValuesDropped_.fetch_add(1, std::memory_order_relaxed);
}

std::uint64_t QVReportingStats::limitExceededCount(Limit limit) const {
    return limitsExceeded_[static_cast<std::size_t>(limit)].load();
}

std::uint64_t QVReportingStats::sinkLinesLost(std::string_view sink) const {
    std::lock_guard lock(mutex_);
    auto it = sinkLinesLost_.find(sink);
    return it == sinkLinesLost_.end() ? 0 : it->second;
}

std::uint64_t QVReportingStats::issueCaptureRefused(std::string_view reason) const {
    std::lock_guard lock(mutex_);
    auto it = issueCaptureRefused_.find(reason);
    return it == issueCaptureRefused_.end() ? 0 : it->second;
}

void QVReportingStats::noteCallBudget(std::size_t callBytes, std::size_t heldCalls) {
    callBytes_.store(callBytes);
    raiseMax(callBytesMax_, callBytes);
    heldCalls_.store(heldCalls);
    raiseMax(heldCallsMax_, heldCalls);
}

void QVReportingStats::noteBusReadsPaused() {
    busReadsPaused_.fetch_add(1, std::memory_order_relaxed);
}

void QVReportingStats::noteDirectConnection() {
    directConnectionsAccepted_.fetch_add(1, std::memory_order_relaxed);
}

Dictionary QVReportingStats::dump() const {
    Dictionary out;
    std::uint64_t limitsTotal = 0;
    for (std::size_t i = 0; i < kLimitKinds; ++i) {
        const auto n = limitsExceeded_[i].load();
        limitsTotal += n;
        out.set(std::string("limit_exceeded_") + std::string(kLimitNames[i]), n);
    }
    out.set("limits_exceeded", limitsTotal);
    out.set("input_refused", inputRefused_.load());
    out.set("log_lines_dropped", logLinesDropped_.load());
    std::uint64_t sinkTotal = 0;
    {
        std::lock_guard lock(mutex_);
        for (const auto& [name, n] : sinkLinesLost_) {
            sinkTotal += n;
            out.set("sink_lines_lost_" + name, n);
        }
    }
    out.set("sink_lines_lost", sinkTotal);
    out.set("sink_torn_lines_removed", sinkTornLinesRemoved_.load());
    std::uint64_t refusedTotal = 0;
    {
        std::lock_guard lock(mutex_);
        for (const auto& [reason, n] : issueCaptureRefused_) {
            refusedTotal += n;
            out.set("issue_capture_refused_" + reason, n);
        }
    }
    out.set("issue_capture_refused", refusedTotal);
    out.set("clients", clients_.load());
    out.set("clients_max", clientsMax_.load());
    out.set("sessions", sessions_.load());
    out.set("sessions_max", sessionsMax_.load());
    out.set("store_bytes", storeBytes_.load());
    out.set("store_bytes_max", storeBytesMax_.load());
    out.set("store_budget_bytes", storeBudget_.load());
    out.set("session_store_budget_bytes", sessionStoreBudget_.load());
    out.set("messages_not_stored", messagesNotStored_.load());
    out.set("previous_values_dropped", previousValuesDropped_.load());
    out.set("call_bytes", callBytes_.load());
    out.set("call_bytes_max", callBytesMax_.load());
    out.set("held_calls", heldCalls_.load());
    out.set("held_calls_max", heldCallsMax_.load());
    out.set("bus_reads_paused", busReadsPaused_.load());
    out.set("direct_connections_accepted", directConnectionsAccepted_.load());
    // Files on disk.
    out.set("files_refused", filesRefused_.load());
    {
        std::lock_guard lock(mutex_);
        for (const auto& [name, n] : bytesExpired_) {
            out.set(name, n);
        }
    }
    return out;
}

void QVReportingStats::TEST_reset() {
    for (auto& n : limitsExceeded_) {
        n.store(0);
    }
    inputRefused_.store(0);
    logLinesDropped_.store(0);
    clients_.store(0);
    clientsMax_.store(0);
    sessions_.store(0);
    sessionsMax_.store(0);
    setStoreBudgets(QVReportingLimits{}.maxSessionStoreBytes, QVReportingLimits{}.maxStoreBytes);
    storeBytesMax_.store(storeBytes_.load());
    messagesNotStored_.store(0);
    previousValuesDropped_.store(0);
    sinkTornLinesRemoved_.store(0);
    callBytes_.store(0);
    callBytesMax_.store(0);
    heldCalls_.store(0);
    heldCallsMax_.store(0);
    busReadsPaused_.store(0);
    directConnectionsAccepted_.store(0);
    std::lock_guard lock(mutex_);
    sinkLinesLost_.clear();
    issueCaptureRefused_.clear();
    filesRefused_.store(0);
    bytesExpired_.clear();
}

}  // namespace qv
