// The facility's accessory side: which accessories' files to read again (marked on pairing, on a
// directory change, or all when the watch overflowed), the reads themselves off the lock, and the
// inotify watch on the accessory directory.
#include "platform/linux/bluetooth/LinuxBluetoothFacility.h"

#include <sys/inotify.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <set>

#include <fmt/format.h>

#include "platform/linux/bluetooth/AccessoryInformationFile.h"

namespace qv {

void LinuxBluetoothFacility::markAllAccessoriesLocked() {
    for (const auto& [path, device] : devices_) {
        if (!device.address.empty()) {
            marked_.push_back(device.address);
        }
    }
}

void LinuxBluetoothFacility::readMarkedAccessories() {
    if (marked_.empty()) {
        return;
    }
    std::sort(marked_.begin(), marked_.end());
    marked_.erase(std::unique(marked_.begin(), marked_.end()), marked_.end());
    std::set<std::string> inUse;
    {
        std::lock_guard lock(mutex_);
        for (const auto& [path, device] : devices_) {
            if (!device.address.empty()) {
                inUse.insert(device.address);
            }
        }
    }
    // Files are read without the lock, so queries never wait on the disk.
    std::vector<std::pair<std::string, AccessoryFileResult>> read;
    for (const auto& address : marked_) {
        if (inUse.count(address) != 0) {
            read.emplace_back(address, QVReportingReadAccessoryFile(accessoryDirectory_, address));
        }
    }
    marked_.clear();

    std::lock_guard lock(mutex_);
    for (auto& [address, result] : read) {
        Accessory& accessory = accessories_[address];
        std::string outcome;
        switch (result.status) {
            case AccessoryFileResult::Status::Loaded:
                accessory.information = std::move(result.information);
                outcome = "loaded";
                break;
            case AccessoryFileResult::Status::Missing:
                accessory.information.reset();
                outcome = "missing";
                break;
            case AccessoryFileResult::Status::Refused:
                accessory.information.reset();
                outcome = "refused: " + result.reason;
                break;
        }
        if (outcome != accessory.lastOutcome) {
            const std::string path = QVReportingAccessoryFilePath(accessoryDirectory_, address);
            if (result.status == AccessoryFileResult::Status::Refused) {
                note(LogLevel::Error,
                     fmt::format("accessory file {} refused: {}; the device has no accessory "
                                 "information",
                                 path, result.reason));
                if (fileRefused_) {
                    fileRefused_();
                }
            } else {
                note(LogLevel::Info, fmt::format("accessory file {} {}", path, outcome));
            }
            accessory.lastOutcome = std::move(outcome);
        }
    }
    // Addresses no device has any longer are forgotten, so the cache stays as small as the list
    // of devices whatever addresses a stack cycles through.
    for (auto it = accessories_.begin(); it != accessories_.end();) {
        const bool used = std::any_of(devices_.begin(), devices_.end(),
                                      [&](const auto& d) { return d.second.address == it->first; });
        it = used ? std::next(it) : accessories_.erase(it);
    }
}

void LinuxBluetoothFacility::watchDirectory() {
    if (inotifyFd_ < 0) {
        inotifyFd_ = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
        if (inotifyFd_ < 0) {
            note(LogLevel::Error,
                 fmt::format(
                     "cannot watch the accessory directory: inotify: {}; files are read when "
                     "a device appears",
                     std::strerror(errno)));
            nextWatchAttempt_ = std::chrono::steady_clock::time_point::max();
            return;
        }
    }
    watch_ = ::inotify_add_watch(inotifyFd_, accessoryDirectory_.c_str(),
                                 IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE |
                                     IN_ATTRIB | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR);
    if (watch_ < 0) {
        if (!directoryMissingLogged_) {
            note(LogLevel::Info,
                 fmt::format(
                     "accessory directory {} cannot be watched: {}; looking again every {} s",
                     accessoryDirectory_, std::strerror(errno),
                     std::chrono::duration_cast<std::chrono::seconds>(kDirectoryRetry).count()));
            directoryMissingLogged_ = true;
        }
        nextWatchAttempt_ = std::chrono::steady_clock::now() + kDirectoryRetry;
        return;
    }
    directoryMissingLogged_ = false;
    // Files may have come with the directory.
    std::lock_guard lock(mutex_);
    markAllAccessoriesLocked();
}

void LinuxBluetoothFacility::drainDirectoryEvents() {
    alignas(inotify_event) char buffer[16 * 1024];
    bool lost = false;
    bool all = false;
    std::vector<std::string> changed;
    for (;;) {
        const ssize_t n = ::read(inotifyFd_, buffer, sizeof buffer);
        if (n <= 0) {
            break;
        }
        for (ssize_t at = 0; at < n;) {
            const auto* event = reinterpret_cast<const inotify_event*>(buffer + at);
            at += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
            if (event->mask & IN_Q_OVERFLOW) {
                all = true;
            }
            if (event->wd == watch_ &&
                (event->mask & (IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF))) {
                lost = true;
            }
            if (event->len == 0) {
                continue;
            }
            const std::string_view name(event->name);
            constexpr std::string_view kSuffix = ".json";
            if (name.size() > kSuffix.size() &&
                name.substr(name.size() - kSuffix.size()) == kSuffix) {
                if (auto address = QVReportingCanonicalBluetoothAddress(
                        name.substr(0, name.size() - kSuffix.size()));
                    address && *address == name.substr(0, address->size())) {
                    changed.push_back(*address);
                }
            }
        }
    }
    if (lost && watch_ >= 0) {
        ::inotify_rm_watch(inotifyFd_, watch_);
        watch_ = -1;
        nextWatchAttempt_ = std::chrono::steady_clock::now();
        all = true;
    }
    std::lock_guard lock(mutex_);
    if (all) {
        markAllAccessoriesLocked();
    }
    marked_.insert(marked_.end(), changed.begin(), changed.end());
}

}  // namespace qv
