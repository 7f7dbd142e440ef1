#include "QVReportingExportFiles.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include <fcntl.h>
#include <unistd.h>

namespace qv::exporter {

namespace {

// Closes a descriptor on every way out.
struct Descriptor {
    int fd = -1;
    ~Descriptor() {
        if (fd >= 0) {
            ::close(fd);
        }
    }
};

std::string failure(std::string_view what, const std::filesystem::path& path) {
    return std::string(what) + " " + path.string() + ": " + std::strerror(errno);
}

}  // namespace

std::string QVReportingExportDefaultStateDirectory(const QVReportingExportEnvironment& environment,
                                                   unsigned effectiveUserID) {
    if (const char* systemd = environment("STATE_DIRECTORY"); systemd && *systemd) {
        const std::string_view dirs = systemd;
        return std::string(dirs.substr(0, dirs.find(':')));
    }
    if (effectiveUserID == 0) {
        return "/var/lib/qvreportd";
    }
    if (const char* xdg = environment("XDG_STATE_HOME"); xdg && *xdg) {
        return std::string(xdg) + "/qvreportd";
    }
    const char* home = environment("HOME");
    return std::string(home && *home ? home : "/tmp") + "/.local/state/qvreportd";
}

std::string QVReportingExportDefaultStateDirectory() {
    return QVReportingExportDefaultStateDirectory(
        [](const char* name) { return std::getenv(name); }, ::geteuid());
}

std::filesystem::path QVReportingExportDirectory(const std::filesystem::path& stateDir) {
    return stateDir / "export";
}

std::filesystem::path QVReportingExportCursorPath(const std::filesystem::path& stateDir) {
    return QVReportingExportDirectory(stateDir) / "cursor.json";
}

std::filesystem::path QVReportingExportStatusPath(const std::filesystem::path& stateDir) {
    return QVReportingExportDirectory(stateDir) / "status.json";
}

std::string QVReportingExportWriteFileAtomically(const std::filesystem::path& path,
                                                 std::string_view text) {
    const auto directory = path.parent_path();
    std::error_code error;
    std::filesystem::create_directories(directory, error);
    if (error) {
        return "cannot create " + directory.string() + ": " + error.message();
    }
    const auto temporary = std::filesystem::path(path.string() + ".tmp");
    {
        Descriptor file{::open(temporary.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644)};
        if (file.fd < 0) {
            return failure("cannot open", temporary);
        }
        for (std::size_t done = 0; done < text.size();) {
            const ssize_t n = ::write(file.fd, text.data() + done, text.size() - done);
            if (n < 0 && errno == EINTR) {
                continue;
            }
            if (n <= 0) {
                return failure("cannot write", temporary);
            }
            done += static_cast<std::size_t>(n);
        }
        if (::fsync(file.fd) != 0) {
            return failure("cannot sync", temporary);
        }
    }
    if (::rename(temporary.c_str(), path.c_str()) != 0) {
        return failure("cannot rename to", path);
    }
    // The rename itself survives a crash only once the directory is on disk.
    Descriptor dir{::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)};
    if (dir.fd < 0 || ::fsync(dir.fd) != 0) {
        return failure("cannot sync", directory);
    }
    return {};
}

}  // namespace qv::exporter
