// A clock that moves only when the test moves it.
#pragma once

#include <atomic>
#include <chrono>

#include "platform/Clock.h"

namespace qv::test {

class FakeClock : public Clock {
  public:
    // Starts at 2024-01-31 13:25:01 UTC, 1000 s after boot.
    double now() const override { return wall_.load(); }
    std::chrono::steady_clock::time_point steadyNow() const override {
        return std::chrono::steady_clock::time_point(
            std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                std::chrono::duration<double>(steady_.load())));
    }
    double systemUptime() const override { return uptime_.load(); }
    long processCPUTime() const override { return cpu_.load(); }

    void advance(double seconds) {
        wall_.store(wall_.load() + seconds);
        steady_.store(steady_.load() + seconds);
        uptime_.store(uptime_.load() + seconds);
    }
    void setNow(double secondsSince1970) { wall_.store(secondsSince1970); }
    void setSystemUptime(double seconds) { uptime_.store(seconds); }
    void setProcessCPUTime(long ticks) { cpu_.store(ticks); }

  private:
    std::atomic<double> wall_{1706707501.0};
    std::atomic<double> steady_{5000.0};
    std::atomic<double> uptime_{1000.0};
    std::atomic<long> cpu_{250000};
};

}  // namespace qv::test
