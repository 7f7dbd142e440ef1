#include "platform/linux/sinks/DiskBudget.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <map>
#include <system_error>
#include <tuple>

#include <fmt/format.h>

#include "platform/SinkSegments.h"

namespace qv {

namespace {

std::timespec modifiedOf(const struct stat& st) {
    return st.st_mtim;
}

bool earlier(const std::timespec& a, const std::timespec& b) {
    return std::tie(a.tv_sec, a.tv_nsec) < std::tie(b.tv_sec, b.tv_nsec);
}

// lstat of a regular file (a link is not followed, nor counted).
bool regularFile(const std::filesystem::path& path, struct stat& st) {
    return ::lstat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode);
}

}  // namespace

DiskBudget::DiskBudget(std::string label, std::uint64_t maxBytes,
                       std::function<std::vector<File>()> list, Callbacks callbacks)
    : label_(std::move(label)),
      maxBytes_(maxBytes),
      list_(std::move(list)),
      callbacks_(std::move(callbacks)) {}

std::uint64_t DiskBudget::enforce() {
    std::lock_guard lock(mutex_);
    std::vector<File> files = list_();
    std::uint64_t total = 0;
    for (const File& file : files) {
        total += file.bytes;
    }
    if (total <= maxBytes_) {
        return 0;
    }
    // Each group oldest first; then the groups merged by their next file's age.
    std::map<std::string, std::vector<File>> groups;
    for (File& file : files) {
        groups[file.group].push_back(std::move(file));
    }
    std::map<std::string, std::size_t> nextOf;
    for (auto& [group, list] : groups) {
        std::sort(list.begin(), list.end(), [](const File& a, const File& b) {
            return a.rank != b.rank ? a.rank < b.rank : a.path < b.path;
        });
        nextOf[group] = 0;
    }
    std::uint64_t removedBytes = 0;
    std::size_t removedFiles = 0;
    while (total > maxBytes_) {
        const File* oldest = nullptr;
        for (const auto& [group, list] : groups) {
            const std::size_t next = nextOf[group];
            if (next < list.size() && (!oldest || earlier(list[next].modified, oldest->modified))) {
                oldest = &list[next];
            }
        }
        if (!oldest) {
            break;
        }
        ++nextOf[oldest->group];
        total -= oldest->bytes;
        if (::unlink(oldest->path.c_str()) != 0) {
            if (errno != ENOENT && callbacks_.problem) {
                callbacks_.problem(
                    fmt::format("{}: cannot remove {} to keep within {} bytes: {}", label_,
                                oldest->path.string(), maxBytes_,
                                std::error_code(errno, std::generic_category()).message()));
            }
            continue;
        }
        removedBytes += oldest->bytes;
        ++removedFiles;
        if (callbacks_.removed) {
            callbacks_.removed(oldest->group, oldest->bytes);
        }
    }
    if (removedFiles > 0 && callbacks_.problem) {
        callbacks_.problem(
            fmt::format("{}: removed the {} oldest files ({} bytes) to keep within "
                        "{} bytes",
                        label_, removedFiles, removedBytes, maxBytes_));
    }
    return removedBytes;
}

std::function<std::vector<DiskBudget::File>()> DiskBudget::filesIn(std::filesystem::path directory,
                                                                   std::string group) {
    return [directory = std::move(directory), group = std::move(group)] {
        std::vector<File> files;
        std::error_code ec;
        for (const auto& entry : std::filesystem::directory_iterator(directory, ec)) {
            struct stat st {};
            if (entry.path().filename().string().starts_with(".") ||
                !regularFile(entry.path(), st)) {
                continue;
            }
            const std::timespec modified = modifiedOf(st);
            files.push_back(File{entry.path(), group,
                                 static_cast<std::uint64_t>(modified.tv_sec) * 1000000000u +
                                     static_cast<std::uint64_t>(modified.tv_nsec),
                                 static_cast<std::uint64_t>(st.st_size), modified});
        }
        return files;
    };
}

std::function<std::vector<DiskBudget::File>()> DiskBudget::closedSinkSegmentsIn(
    std::filesystem::path sinksDir) {
    return [sinksDir = std::move(sinksDir)] {
        std::vector<File> files;
        for (const auto& sink : QVReportingListSinks(sinksDir)) {
            for (const auto& segment : QVReportingListSinkSegments(sinksDir, sink)) {
                struct stat st {};
                if (segment.current || !regularFile(segment.path, st)) {
                    continue;
                }
                files.push_back(File{segment.path, sink, segment.firstSeq,
                                     static_cast<std::uint64_t>(st.st_size), modifiedOf(st)});
            }
        }
        return files;
    };
}

}  // namespace qv
