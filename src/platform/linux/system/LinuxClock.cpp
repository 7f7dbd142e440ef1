#include "platform/linux/system/LinuxClock.h"

#include <time.h>

namespace qv {

namespace {

double secondsOf(clockid_t id) {
    timespec ts{};
    if (clock_gettime(id, &ts) != 0) {
        return 0;
    }
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
}

}  // namespace

double LinuxClock::now() const {
    return secondsOf(CLOCK_REALTIME);
}

std::chrono::steady_clock::time_point LinuxClock::steadyNow() const {
    return std::chrono::steady_clock::now();
}

double LinuxClock::systemUptime() const {
    return secondsOf(CLOCK_BOOTTIME);
}

long LinuxClock::processCPUTime() const {
    // Microseconds, the unit of clock() with CLOCKS_PER_SEC of 1,000,000.
    timespec ts{};
    if (clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &ts) != 0) {
        return 0;
    }
    return static_cast<long>(ts.tv_sec) * 1000000L + static_cast<long>(ts.tv_nsec / 1000);
}

}  // namespace qv
