// Clock on Linux: CLOCK_REALTIME, CLOCK_MONOTONIC, CLOCK_BOOTTIME and the process CPU clock.
#pragma once

#include "platform/Clock.h"

namespace qv {

class LinuxClock final : public Clock {
  public:
    double now() const override;
    std::chrono::steady_clock::time_point steadyNow() const override;
    double systemUptime() const override;
    long processCPUTime() const override;
};

}  // namespace qv
