#include "platform/linux/system/LinuxProcessInfo.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

namespace qv {

namespace {

// comm holds at most 15 bytes and a line feed; anything longer is not a comm file.
constexpr std::size_t kMaximumCommLength = 64;

}  // namespace

LinuxProcessInfo::LinuxProcessInfo(std::string procRoot) : procRoot_(std::move(procRoot)) {}

std::optional<std::string> LinuxProcessInfo::processName(std::int64_t pid) const {
    if (pid <= 0) {
        return std::nullopt;
    }
    const std::string path = procRoot_ + "/" + std::to_string(pid) + "/comm";
    const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
    if (fd < 0) {
        return std::nullopt;
    }
    char buffer[kMaximumCommLength];
    ssize_t n;
    do {
        n = ::read(fd, buffer, sizeof buffer);
    } while (n < 0 && errno == EINTR);
    ::close(fd);
    if (n < 0) {
        return std::nullopt;
    }
    std::string name(buffer, static_cast<std::size_t>(n));
    if (!name.empty() && name.back() == '\n') {
        name.pop_back();
    }
    return name;
}

std::int64_t LinuxProcessInfo::ownProcessIdentifier() const {
    return static_cast<std::int64_t>(::getpid());
}

}  // namespace qv
