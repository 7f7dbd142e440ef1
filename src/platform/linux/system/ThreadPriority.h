// Thread priorities on Linux, where a niceness belongs to a thread: background threads (the task
// pool, the sink writers) run a few steps below the reporting server queue and the bus thread, so
// that on a busy machine a client's call gets the processor before bookkeeping that can wait.
#pragma once

namespace qv {

// Niceness the background threads add to the process's.
inline constexpr int kBackgroundNiceness = 4;

// Lowers the calling thread's priority by steps. A thread may always make itself nicer, so this
// fails (silently) only on a system without priorities.
void QVReportingLowerOwnThreadPriority(int steps);

}  // namespace qv
