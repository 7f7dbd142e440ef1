#include "service/QVReportingDirectSocket.h"

#include <errno.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <stdexcept>

#include <fmt/format.h>

namespace qv {

namespace {

constexpr int kBacklog = 128;

std::runtime_error failure(const std::string& path, const char* what) {
    return std::runtime_error(
        fmt::format("direct socket {}: {}: {}", path, what, std::strerror(errno)));
}

// Whether a process accepts connections on the socket at path.
bool someoneListens(const sockaddr_un& address) {
    const int probe = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (probe < 0) {
        return false;
    }
    const bool connected =
        ::connect(probe, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
    ::close(probe);
    return connected;
}

}  // namespace

std::unique_ptr<QVReportingDirectSocket> QVReportingDirectSocket::listen(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.empty() || path.size() >= sizeof address.sun_path) {
        throw std::runtime_error(fmt::format("direct socket {}: not a usable socket path", path));
    }
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);

    struct stat st {};
    if (::lstat(path.c_str(), &st) == 0) {
        if (!S_ISSOCK(st.st_mode)) {
            throw std::runtime_error(
                fmt::format("direct socket {}: something that is not a socket is there", path));
        }
        if (someoneListens(address)) {
            throw std::runtime_error(
                fmt::format("direct socket {}: another process listens on it", path));
        }
        // Left by a daemon that did not stop normally.
        if (::unlink(path.c_str()) != 0) {
            throw failure(path, "cannot remove the stale socket");
        }
    }

    const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    if (fd < 0) {
        throw failure(path, "socket");
    }
    if (::bind(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
        const auto error = failure(path, "bind");
        ::close(fd);
        throw error;
    }
    // Any user may connect (the umask would otherwise decide), as any user may call on the bus.
    if (::chmod(path.c_str(), 0666) != 0 || ::lstat(path.c_str(), &st) != 0 ||
        ::listen(fd, kBacklog) != 0) {
        const auto error = failure(path, "chmod, stat or listen");
        ::unlink(path.c_str());
        ::close(fd);
        throw error;
    }
    return std::unique_ptr<QVReportingDirectSocket>(
        new QVReportingDirectSocket(fd, path, st.st_dev, st.st_ino));
}

QVReportingDirectSocket::~QVReportingDirectSocket() {
    struct stat st {};
    if (::lstat(path_.c_str(), &st) == 0 && st.st_dev == dev_ && st.st_ino == ino_) {
        ::unlink(path_.c_str());
    }
    ::close(fd_);
}

std::optional<QVReportingDirectSocket::Peer> QVReportingDirectSocket::accept() {
    const int fd = ::accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
    if (fd < 0) {
        return std::nullopt;
    }
    ucred credentials{};
    socklen_t size = sizeof credentials;
    if (::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &credentials, &size) != 0) {
        ::close(fd);
        return std::nullopt;
    }
    return Peer{fd, credentials.pid, credentials.uid};
}

}  // namespace qv
