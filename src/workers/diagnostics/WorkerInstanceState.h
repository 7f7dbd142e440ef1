// The counting state of one ICX detector: how many interesting messages it has seen since it last
// fired, the thresholds that make it fire, and what it last asked the issue-capture service for.
// The detectors that share one state across every session of the process find it in the
// process-wide registry below, by their class name.
//
// Thread safety: the counters and thresholds are read and written on the reporting server queue
// only (sessions deliver one message at a time there). currentIcxSessionIdentifier is the one
// field that reply callbacks of the issue-capture service write from their own threads; it is
// guarded by a lock of its own and read through a copy.
#pragma once

#include <cstdint>
#include <functional>
#include <limits>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "values/Value.h"

namespace qv {

class IssueCaptureReporter;

// An optional payload that keeps its storage when cleared: a detector counting a flood copies
// each counted payload over the last one instead of allocating a fresh copy every time.
class QVReportingICXLastPayload {
  public:
    explicit operator bool() const { return present_; }
    bool has_value() const { return present_; }
    const Dictionary& operator*() const { return value_; }
    const Dictionary* operator->() const { return &value_; }
    QVReportingICXLastPayload& operator=(const Dictionary& payload) {
        value_ = payload;
        present_ = true;
        return *this;
    }
    void reset() { present_ = false; }

  private:
    Dictionary value_;
    bool present_ = false;
};

class WorkerInstanceState {
  public:
    // Identifier of the last issue-capture session or snapshot the service reported started.
    std::optional<std::string> currentIcxSessionIdentifier() const;
    void setCurrentIcxSessionIdentifier(std::string identifier);

    // Interesting messages counted since the last fire.
    std::uint64_t interestedCount = 0;
    // Count at which the detector may fire; 0 selects the time rule. All ones: never reached.
    std::uint64_t interestThresholdCount = std::numeric_limits<std::uint64_t>::max();
    // Wall-clock time (seconds since 1970) of the first interesting message since the last fire.
    std::optional<double> interestFirstSeen;
    // With a count threshold of 0: seconds that must have passed since interestFirstSeen.
    double interestThresholdDurationSeconds = std::numeric_limits<double>::max();
    // Fire at most once while firedCount is nonzero.
    bool oncePerSession = false;
    // Fires over the life of the state; never reset.
    std::uint64_t firedCount = 0;
    // Payload of the last counted message: an exact repeat never counts twice in a row.
    QVReportingICXLastPayload lastMessage;
    // The issue-capture client made for the latest fire.
    std::shared_ptr<IssueCaptureReporter> issueReporter;

  private:
    mutable std::mutex identifierMutex_;
    std::optional<std::string> currentIcxSessionIdentifier_;  // guarded by identifierMutex_
};

// The process-wide registry of shared detector states, keyed by detector class name. Created once
// per process and never cleared, except by tests.
class QVReportingICXSharedStates {
  public:
    // The state stored under className; when there is none, one is made, handed to configure
    // (which sets the detector's thresholds) and stored.
    static std::shared_ptr<WorkerInstanceState> stateForClass(
        std::string_view className, const std::function<void(WorkerInstanceState&)>& configure);

    // For tests only: forgets every shared state. No detector may be counting meanwhile.
    static void TEST_reset();
};

}  // namespace qv
