// Process facts on Linux, read from /proc.
#pragma once

#include <string>

#include "platform/ProcessInfo.h"

namespace qv {

class LinuxProcessInfo final : public ProcessInfo {
  public:
    // procRoot is where the proc file system is mounted; tests may point it elsewhere.
    explicit LinuxProcessInfo(std::string procRoot = "/proc");

    // The contents of <procRoot>/PID/comm without its line feed; nothing for pid <= 0, a
    // process that is gone, or a file that cannot be read.
    std::optional<std::string> processName(std::int64_t pid) const override;
    // getpid().
    std::int64_t ownProcessIdentifier() const override;

  private:
    const std::string procRoot_;
};

}  // namespace qv
