#include "platform/linux/sinks/LinuxAnalyticsService.h"

#include <fcntl.h>
#include <fnmatch.h>
#include <unistd.h>

#include <cerrno>
#include <system_error>

#include <fmt/format.h>

namespace qv {

namespace {

constexpr std::string_view kWhiteSpace = " \t\r\n\v\f";
// The events file is a short hand-written list; anything this large is not one.
constexpr std::size_t kMaxEventsFileBytes = 1024 * 1024;

std::string_view trim(std::string_view text) {
    const auto first = text.find_first_not_of(kWhiteSpace);
    if (first == std::string_view::npos) {
        return {};
    }
    const auto last = text.find_last_not_of(kWhiteSpace);
    return text.substr(first, last - first + 1);
}

// The whole file, or nothing with the reason in error. Read with read(2) so that a directory or
// an unreadable file is an error rather than an empty list.
std::optional<std::string> readFile(const std::string& path, std::string& error) {
    int fd;
    do {
        fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    } while (fd < 0 && errno == EINTR);
    if (fd < 0) {
        error = std::error_code(errno, std::generic_category()).message();
        return std::nullopt;
    }
    std::string contents;
    char buffer[4096];
    for (;;) {
        const ssize_t n = ::read(fd, buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            error = std::error_code(errno, std::generic_category()).message();
            ::close(fd);
            return std::nullopt;
        }
        if (n == 0) {
            break;
        }
        contents.append(buffer, static_cast<std::size_t>(n));
        if (contents.size() > kMaxEventsFileBytes) {
            error = fmt::format("larger than {} bytes", kMaxEventsFileBytes);
            ::close(fd);
            return std::nullopt;
        }
    }
    ::close(fd);
    return contents;
}

std::vector<std::string> parsePatterns(std::string_view contents) {
    std::vector<std::string> patterns;
    while (!contents.empty()) {
        const auto end = contents.find('\n');
        const std::string_view line = trim(contents.substr(0, end));
        contents = end == std::string_view::npos ? std::string_view{} : contents.substr(end + 1);
        if (line.empty() || line.front() == '#') {
            continue;
        }
        patterns.emplace_back(line);
    }
    return patterns;
}

}  // namespace

LinuxAnalyticsService::Created LinuxAnalyticsService::create(const std::string& stateDir,
                                                             const Clock& clock,
                                                             const std::string& eventsFile,
                                                             SinkCallbacks callbacks,
                                                             SinkSegmentPolicy segments) {
    std::optional<std::vector<std::string>> patterns;
    if (!eventsFile.empty()) {
        std::string error;
        const auto contents = readFile(eventsFile, error);
        if (!contents) {
            return {nullptr,
                    fmt::format("cannot read the analytics events file {}: {}", eventsFile, error)};
        }
        patterns = parsePatterns(*contents);
    }
    auto sink =
        std::make_unique<JsonlSink>(stateDir, std::string(kSinkName), clock, std::move(callbacks),
                                    JsonlSink::kDefaultCapacity, std::move(segments));
    return {std::make_unique<LinuxAnalyticsService>(std::move(sink), std::move(patterns)), {}};
}

LinuxAnalyticsService::LinuxAnalyticsService(std::unique_ptr<JsonlSink> sink,
                                             std::optional<std::vector<std::string>> eventPatterns)
    : sink_(std::move(sink)), everyEventUsed_(!eventPatterns) {
    if (!eventPatterns) {
        return;
    }
    for (auto& pattern : *eventPatterns) {
        if (pattern.find_first_of("*?[\\") == std::string::npos) {
            exactNames_.insert(std::move(pattern));
        } else {
            globs_.push_back(std::move(pattern));
        }
    }
}

bool LinuxAnalyticsService::isEventUsed(std::string_view eventName) const {
    if (everyEventUsed_) {
        return true;
    }
    const std::string name(eventName);
    if (exactNames_.contains(name)) {
        return true;
    }
    for (const auto& glob : globs_) {
        if (::fnmatch(glob.c_str(), name.c_str(), 0) == 0) {
            return true;
        }
    }
    return false;
}

void LinuxAnalyticsService::sendEventLazy(std::string_view eventName, PayloadProducer producer) {
    if (!producer || !isEventUsed(eventName)) {
        return;
    }
    Dictionary members;
    members.reserve(2);
    members.set("event", eventName);
    members.set("payload", producer());
    sink_->append(std::move(members));
}

}  // namespace qv
