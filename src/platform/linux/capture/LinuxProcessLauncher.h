// Process execution on Linux: posix_spawn of /bin/sh -c in a process group of its own, standard
// output a pipe, standard input and error /dev/null, signals reset to their defaults and none
// blocked (the daemon blocks its stop signals and ignores SIGPIPE; a pipeline must not inherit
// that). At the time-out or the byte limit the whole group is killed with SIGKILL.
//
// A shell that exits with 126 or 127 without printing anything could not find or run the
// command: that is reported as NotExecutable.
//
// Thread safety: launch() may be called from any thread; the time-out is read on the real
// monotonic clock.
#pragma once

#include "platform/ProcessLauncher.h"

namespace qv {

class LinuxProcessLauncher final : public ProcessLauncher {
  public:
    Launched launch(const std::string& command, const ProcessPipeLimits& limits) override;
};

}  // namespace qv
