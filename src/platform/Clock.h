// Time as the daemon sees it. Every time rule (timestamp validity, idle reaping, rate limits,
// back-off) reads one of these clocks, so tests can drive time without sleeping.
//
// Thread safety: implementations are safe to call from any thread.
#pragma once

#include <chrono>

namespace qv {

class Clock {
  public:
    virtual ~Clock() = default;

    // Wall-clock time, seconds since 1970-01-01 UTC, with sub-second precision.
    virtual double now() const = 0;
    // Monotonic time for intervals and deadlines; never goes back.
    virtual std::chrono::steady_clock::time_point steadyNow() const = 0;
    // Seconds since the system booted.
    virtual double systemUptime() const = 0;
    // Processor time used by this process so far, in clock ticks of 1,000,000 per second.
    virtual long processCPUTime() const = 0;
};

}  // namespace qv
