// Facts about processes: names of other processes and this process's own identity.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace qv {

class ProcessInfo {
  public:
    virtual ~ProcessInfo() = default;

    // The short name of a running process (its command name), or nothing when it cannot be read.
    virtual std::optional<std::string> processName(std::int64_t pid) const = 0;
    virtual std::int64_t ownProcessIdentifier() const = 0;
};

}  // namespace qv
