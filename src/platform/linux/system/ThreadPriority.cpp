#include "platform/linux/system/ThreadPriority.h"

#include <sys/resource.h>
#include <unistd.h>

#include <cerrno>

namespace qv {

void QVReportingLowerOwnThreadPriority(int steps) {
    const pid_t tid = ::gettid();
    errno = 0;
    const int current = ::getpriority(PRIO_PROCESS, static_cast<id_t>(tid));
    if (errno == 0) {
        ::setpriority(PRIO_PROCESS, static_cast<id_t>(tid), current + steps);
    }
}

}  // namespace qv
