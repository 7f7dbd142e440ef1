#include "platform/linux/trace/TracefsFiles.h"

#include <fcntl.h>
#include <sys/statfs.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstdlib>
#include <fstream>
#include <sstream>

#include <fmt/format.h>

#include "platform/PosixIO.h"

namespace qv::tracefs {

namespace {

constexpr long kTracefsMagic = 0x74726163;  // "trac"

}  // namespace

namespace fs = std::filesystem;

bool isTracefs(const fs::path& path) {
    struct statfs st {};
    return ::statfs(path.c_str(), &st) == 0 && st.f_type == kTracefsMagic;
}

int writeControl(const fs::path& path, std::string_view text) {
    const int fd = ::open(path.c_str(), O_WRONLY | O_CLOEXEC);
    if (fd < 0) {
        return errno;
    }
    const int error = writeAll(fd, text) ? 0 : errno;
    ::close(fd);
    return error;
}

std::string readSmall(const fs::path& path) {
    std::ifstream in(path);
    std::string text;
    std::getline(in, text);
    return text;
}

std::optional<double> processStartTime(long pid) {
    std::ifstream stat(fmt::format("/proc/{}/stat", pid));
    std::string line;
    if (!std::getline(stat, line)) {
        return std::nullopt;
    }
    // Field 22 (starttime, clock ticks after boot) counts from the field after "(comm)".
    const auto close = line.rfind(')');
    if (close == std::string::npos) {
        return std::nullopt;
    }
    std::istringstream fields(line.substr(close + 2));
    std::string field;
    unsigned long long ticks = 0;
    for (int i = 3; i <= 22 && fields >> field; ++i) {
        if (i == 22) {
            ticks = std::strtoull(field.c_str(), nullptr, 10);
        }
    }
    std::ifstream procStat("/proc/stat");
    double bootTime = 0;
    while (std::getline(procStat, line)) {
        if (line.starts_with("btime ")) {
            bootTime = std::strtod(line.c_str() + 6, nullptr);
            break;
        }
    }
    return bootTime + static_cast<double>(ticks) / static_cast<double>(::sysconf(_SC_CLK_TCK));
}

std::optional<long> instanceOwner(std::string_view name) {
    if (!name.starts_with(kInstancePrefix)) {
        return std::nullopt;
    }
    name.remove_prefix(kInstancePrefix.size());
    long pid = 0;
    const auto [end, ec] = std::from_chars(name.data(), name.data() + name.size(), pid);
    if (ec != std::errc() || end == name.data() + name.size() || *end != '-' || pid <= 0) {
        return std::nullopt;
    }
    return pid;
}

}  // namespace qv::tracefs
