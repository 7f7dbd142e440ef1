#include "platform/linux/sinks/RegularFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include <fmt/format.h>

namespace qv {

namespace {

RegularFileRead refused(std::string reason) {
    return {RegularFileRead::Status::Refused, {}, std::move(reason)};
}

}  // namespace

const char* QVReportingFileKind(unsigned mode) {
    switch (mode & S_IFMT) {
        case S_IFREG:
            return "a regular file";
        case S_IFDIR:
            return "a directory";
        case S_IFIFO:
            return "a FIFO";
        case S_IFSOCK:
            return "a socket";
        case S_IFCHR:
            return "a character device";
        case S_IFBLK:
            return "a block device";
        case S_IFLNK:
            return "a symbolic link";
        default:
            return "of an unknown kind";
    }
}

RegularFileRead QVReportingReadRegularFile(const std::string& path, std::size_t maxBytes) {
    int fd;
    do {
        fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY);
    } while (fd < 0 && errno == EINTR);
    if (fd < 0) {
        if (errno == ENOENT) {
            return {};
        }
        if (errno == ELOOP) {
            return refused("it is a symbolic link");
        }
        return refused(fmt::format("cannot open it: {}", std::strerror(errno)));
    }
    struct Closer {
        int fd;
        ~Closer() { ::close(fd); }
    } closer{fd};
    struct stat st {};
    if (::fstat(fd, &st) != 0) {
        return refused(fmt::format("cannot examine it: {}", std::strerror(errno)));
    }
    if (!S_ISREG(st.st_mode)) {
        return refused(
            fmt::format("it is {}, not a regular file", QVReportingFileKind(st.st_mode)));
    }
    if (static_cast<std::uint64_t>(st.st_size) > maxBytes) {
        return refused(
            fmt::format("it holds {} bytes, more than the {} accepted", st.st_size, maxBytes));
    }
    RegularFileRead r;
    r.status = RegularFileRead::Status::Read;
    r.text.resize(static_cast<std::size_t>(st.st_size) + 1);
    std::size_t length = 0;
    for (;;) {
        if (length == r.text.size()) {
            if (length > maxBytes) {
                return refused(fmt::format("it holds more than the {} bytes accepted", maxBytes));
            }
            r.text.resize(std::min(maxBytes + 1, length * 2));
        }
        const ssize_t n = ::read(fd, r.text.data() + length, r.text.size() - length);
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            return refused(fmt::format("cannot read it: {}", std::strerror(errno)));
        }
        if (n == 0) {
            break;
        }
        length += static_cast<std::size_t>(n);
    }
    r.text.resize(length);
    return r;
}

}  // namespace qv
