// The daemon's socket beside the bus: a listening unix stream socket on which clients open
// peer-to-peer D-Bus connections to the daemon, without the broker in between. Each accepted
// connection comes with its peer's credentials as the kernel gives them (SO_PEERCRED).
//
// The socket is made readable and writable by everyone (mode 0666): whoever may call the
// reporting methods on the bus may call them here; the one method the bus policy keeps to root
// (KillService) is checked against the peer's uid by the server.
//
// Thread safety: none; one thread uses it (the server's loop).
#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>

namespace qv {

class QVReportingDirectSocket {
  public:
    struct Peer {
        int fd;  // non-blocking, close-on-exec; the caller owns it
        pid_t pid;
        uid_t uid;
    };

    // Listens at path. A stale socket left there (nobody listening) is replaced; a socket that
    // another process listens on, or anything else at path, is refused. Throws
    // std::runtime_error saying why.
    static std::unique_ptr<QVReportingDirectSocket> listen(const std::string& path);
    // Stops listening and removes the socket, unless something else has taken its place.
    ~QVReportingDirectSocket();

    QVReportingDirectSocket(const QVReportingDirectSocket&) = delete;
    QVReportingDirectSocket& operator=(const QVReportingDirectSocket&) = delete;

    int fd() const { return fd_; }
    const std::string& path() const { return path_; }
    // The next connection waiting; nothing when none is (or accepting failed: see errno).
    std::optional<Peer> accept();

  private:
    QVReportingDirectSocket(int fd, std::string path, dev_t dev, ino_t ino)
        : fd_(fd), path_(std::move(path)), dev_(dev), ino_(ino) {}

    int fd_;
    std::string path_;
    dev_t dev_;  // of the socket file made, so that only it is removed
    ino_t ino_;
};

}  // namespace qv
