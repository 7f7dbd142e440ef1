// The real Linux platform on a temporary state directory, for the benchmarks: what a session and
// its workers reach costs what it costs in the daemon. The directory goes with the object.
#pragma once

#include <unistd.h>

#include <filesystem>
#include <string>

#include "platform/Platform.h"
#include "platform/linux/LinuxAnalyticsService.h"
#include "platform/linux/LinuxClock.h"
#include "platform/linux/LinuxConvoService.h"
#include "platform/linux/LinuxDeviceInformation.h"
#include "platform/linux/LinuxNotificationCenter.h"
#include "platform/linux/LinuxPreferenceStore.h"
#include "platform/linux/LinuxProcessInfo.h"
#include "platform/linux/LinuxSystemCondition.h"
#include "platform/linux/LinuxTaskExecutor.h"
#include "session/QVReportingLog.h"

namespace qv::bench {

struct BenchPlatform {
    explicit BenchPlatform(const std::string& name)
        : stateDir(
              (std::filesystem::temp_directory_path() / (name + "-" + std::to_string(::getpid())))
                  .string()) {
        setLogLevel(LogLevel::Error);
    }
    ~BenchPlatform() { std::filesystem::remove_all(stateDir); }

    std::string stateDir;
    LinuxClock clock;
    LinuxDeviceInformation device{"/nonexistent", std::filesystem::path(stateDir) / "logs"};
    LinuxProcessInfo process;
    LinuxPreferenceStore preferences{stateDir};
    LinuxNotificationCenter notifications;
    LinuxAnalyticsService::Created analytics =
        LinuxAnalyticsService::create(stateDir, clock, "", SinkCallbacks{});
    LinuxSystemCondition condition;
    LinuxConvoService convo{preferences, std::make_unique<JsonlSink>(
                                             stateDir, std::string(LinuxConvoService::kSinkName),
                                             clock, SinkCallbacks{})};
    LinuxTaskExecutor executor;
    Platform platform{clock,     device, process, preferences, notifications, *analytics.service,
                      condition, convo,  executor};
};

}  // namespace qv::bench
