// The real Linux platform on a temporary state directory, for the benchmarks: what a session and
// its workers reach costs what it costs in the daemon. The directory goes with the object.
#pragma once

#include <unistd.h>

#include <filesystem>
#include <limits>
#include <string>

#include "platform/Platform.h"
#include "platform/linux/bluetooth/LinuxBluetoothFacility.h"
#include "platform/linux/capture/LinuxDiagnosticRequestService.h"
#include "platform/linux/capture/LinuxIssueCaptureService.h"
#include "platform/linux/capture/LinuxIssueFilerService.h"
#include "platform/linux/capture/LinuxProcessLauncher.h"
#include "platform/linux/sinks/LinuxAnalyticsService.h"
#include "platform/linux/sinks/LinuxConvoService.h"
#include "platform/linux/sinks/LinuxEnergyLogService.h"
#include "platform/linux/sinks/LinuxMTXMetricsService.h"
#include "platform/linux/stats/LinuxStatFeed.h"
#include "platform/linux/system/LinuxClock.h"
#include "platform/linux/system/LinuxDeviceInformation.h"
#include "platform/linux/system/LinuxNotificationCenter.h"
#include "platform/linux/system/LinuxPreferenceStore.h"
#include "platform/linux/system/LinuxProcessInfo.h"
#include "platform/linux/system/LinuxSystemCondition.h"
#include "platform/linux/system/LinuxTaskExecutor.h"
#include "platform/linux/trace/LinuxGaugeDataWriter.h"
#include "platform/linux/trace/LinuxSpanTraceRecorder.h"
#include "platform/linux/trace/LinuxThreadlineModelReader.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingStats.h"

namespace qv::bench {

struct BenchPlatform {
    explicit BenchPlatform(const std::string& name)
        : stateDir(
              (std::filesystem::temp_directory_path() / (name + "-" + std::to_string(::getpid())))
                  .string()) {
        setLogLevel(LogLevel::Error);
        // Sessions of 10^5 and 10^6 messages are measured, beyond the daemon's store budgets.
        QVReportingStats::shared().setStoreBudgets(std::numeric_limits<std::size_t>::max(),
                                                   std::numeric_limits<std::size_t>::max());
    }
    ~BenchPlatform() { std::filesystem::remove_all(stateDir); }

    static LinuxSpanTraceRecorder::Options traceOptions(const std::string& stateDir) {
        LinuxSpanTraceRecorder::Options options;
        options.traceDirectory = std::filesystem::path(stateDir) / "logs/Audio/Traces/raw";
        return options;
    }

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
    // No BlueZ here: the benchmarks gather no accessory information.
    LinuxBluetoothFacility bluetooth{"unix:path=" + stateDir + "/no-bluez-bus", stateDir, {}};
    LinuxIssueCaptureService issueCapture{
        clock, preferences,
        std::make_unique<JsonlSink>(stateDir, std::string(LinuxIssueCaptureService::kSinkName),
                                    clock, SinkCallbacks{}),
        LinuxIssueCaptureService::Options{
            (std::filesystem::path(stateDir) / "logs" / "Audio" / "Captures").string(),
            std::nullopt, ::getpid()},
        LinuxIssueCaptureService::Callbacks{[](std::string_view reason) {
                                                QVReportingStats::shared().noteIssueCaptureRefused(
                                                    reason);
                                            },
                                            {}}};

    LinuxIssueFilerService issueFiler{
        std::make_unique<JsonlSink>(stateDir, std::string(LinuxIssueFilerService::kSinkName), clock,
                                    SinkCallbacks{}),
        LinuxIssueFilerService::Options{}};
    LinuxDiagnosticRequestService diagnostics{
        clock,
        std::make_unique<JsonlSink>(stateDir, std::string(LinuxDiagnosticRequestService::kSinkName),
                                    clock, SinkCallbacks{}),
        LinuxDiagnosticRequestService::Options{
            .spinlogsDirectory = std::filesystem::path(stateDir) / "logs/Audio/Spinlogs",
            .notice = nullptr}};

    LinuxSpanTraceRecorder spanTrace{traceOptions(stateDir), {}};
    LinuxThreadlineModelReader threadline;
    LinuxGaugeDataWriter gaugeData;

    LinuxStatFeed statFeed{"/", clock};
    LinuxProcessLauncher processLauncher;

    LinuxMTXMetricsService mtx{std::make_unique<JsonlSink>(
        stateDir, std::string(LinuxMTXMetricsService::kSinkName), clock, SinkCallbacks{})};
    LinuxEnergyLogService energyLog{std::make_unique<JsonlSink>(
        stateDir, std::string(LinuxEnergyLogService::kSinkName), clock, SinkCallbacks{})};

    LinuxTaskExecutor executor;

    Platform platform{
        clock,     device,     process,   preferences,  notifications,   *analytics.service,
        condition, convo,      bluetooth, issueCapture, issueFiler,      diagnostics,
        spanTrace, threadline, gaugeData, statFeed,     processLauncher, mtx,
        energyLog, executor};

    // The platform with some services replaced, for a caller that brings its own.
    Platform with(const PlatformReplacements& r) const { return withReplacements(platform, r); }
};

}  // namespace qv::bench
