// qvreportd: the composition root. Builds the platform from its Linux implementations, hands the
// worker table to the registry, starts the system monitor and the service, serves D-Bus, and on
// SIGTERM or SIGINT stops every session (so workers flush) before leaving.
#include <malloc.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <memory>

#include <systemd/sd-bus.h>

#include "monitoring/QVReportingSystemMonitor.h"
#include "platform/linux/bluetooth/LinuxBluetoothFacility.h"
#include "platform/linux/capture/LinuxDiagnosticRequestService.h"
#include "platform/linux/capture/LinuxIssueCaptureService.h"
#include "platform/linux/capture/LinuxIssueFilerService.h"
#include "platform/linux/capture/LinuxProcessLauncher.h"
#include "platform/linux/sinks/DiskBudget.h"
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
#include "service/QVReportingDBusServer.h"
#include "service/QVReportingDaemonOptions.h"
#include "service/QVReportingDirectSocket.h"
#include "service/QVReportingService.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingStats.h"
#include "session/QVReportingWorkerRegistry.h"
#include "session/RepeatingTimer.h"
#include "session/SerialQueue.h"
#include "workers/QVReportingWorkerClasses.h"

namespace {

using namespace qv;

// The bus connection, opened but not yet owning a name; throws std::runtime_error.
sd_bus* connectTo(const std::string& address) {
    sd_bus* bus = nullptr;
    int r = 0;
    if (address == "system") {
        r = sd_bus_open_system(&bus);
    } else if (address == "session") {
        r = sd_bus_open_user(&bus);
    } else if ((r = sd_bus_new(&bus)) >= 0) {
        if ((r = sd_bus_set_address(bus, address.c_str())) >= 0 &&
            (r = sd_bus_set_bus_client(bus, 1)) >= 0) {
            r = sd_bus_start(bus);
        }
        if (r < 0) {
            bus = sd_bus_unref(bus);
        }
    }
    if (r < 0) {
        throw std::runtime_error(std::strerror(-r));
    }
    return bus;
}

// Stopped sessions free their messages in bulk, but the allocator keeps freed pages inside its
// arenas. Once this much lies free, it is handed back to the system, so that the daemon's
// footprint follows its load instead of its busiest moment.
constexpr std::size_t kFreeBytesWorthReturning = 1u << 20;

// A stop has 10 seconds: the pool's work (Convo summaries and flushes) gets at most this long,
// then the sinks get theirs.
constexpr std::chrono::milliseconds kPoolDrainTimeout{5000};
constexpr auto kShutdownFlushTimeout = std::chrono::seconds(4);

// The sinks keep to their budget whenever one closes a segment; the log directories, whose files
// are written by workers and services that know nothing of budgets, are looked at this often.
constexpr auto kLogBudgetInterval = std::chrono::seconds(30);

void returnFreeMemory() {
    if (mallinfo2().fordblks > kFreeBytesWorthReturning) {
        malloc_trim(0);
    }
}

}  // namespace

int main(int argc, char** argv) {
    // One arena for every thread: with one per thread, the pages that the pool's and the sinks'
    // threads touched under load stayed with them (an idle daemon held 80 MB after a burst, not
    // 12), and the measured throughput is the same with one.
    mallopt(M_ARENA_MAX, 1);
    int exitCode = 0;
    const auto options = QVReportingParseDaemonOptions(argc, argv, exitCode);
    if (!options) {
        return exitCode;
    }
    setLogSink(makeDefaultLogSink("qvreportd"));
    setLogLevel(options->logLevel);

    // Signals are taken by sigwait() below; every thread started from here on inherits the mask,
    // so no handler ever runs inside a worker.
    sigset_t stopSignals;
    sigemptyset(&stopSignals);
    sigaddset(&stopSignals, SIGTERM);
    sigaddset(&stopSignals, SIGINT);
    pthread_sigmask(SIG_BLOCK, &stopSignals, nullptr);
    signal(SIGPIPE, SIG_IGN);
    // Under a file size limit (LimitFSIZE=, ulimit -f) a write past it fails with EFBIG, which
    // the sinks count as lines lost, instead of killing the daemon.
    signal(SIGXFSZ, SIG_IGN);

    std::error_code ec;
    std::filesystem::create_directories(options->stateDir, ec);
    if (ec) {
        QVLOG_ERROR(QVReportingServiceDelegateCategory(),
                    "cannot create the state directory {}: {}", options->stateDir, ec.message());
        return 1;
    }

    auto reportProblem = [](const std::string& message) {
        QVLOG_ERROR(QVReportingServiceDelegateCategory(), "{}", message);
    };
    LinuxClock clock;
    LinuxDeviceInformation device(options->deviceFile,
                                  std::filesystem::path(options->stateDir) / "logs",
                                  options->internalBuild);
    if (!device.loadError().empty()) {
        QVLOG_ERROR(QVReportingServiceDelegateCategory(), "device file ignored: {}",
                    device.loadError());
    }
    if (device.fileRefused()) {
        QVReportingStats::shared().noteFileRefused();
    }
    LinuxProcessInfo process;
    LinuxPreferenceStore preferences(options->stateDir, reportProblem,
                                     [] { QVReportingStats::shared().noteFileRefused(); });
    LinuxNotificationCenter notifications;
    const SinkCallbacks sinkCallbacks{
        [](std::string_view sink) { QVReportingStats::shared().noteSinkLineLost(sink); },
        [](std::string_view) { QVReportingStats::shared().noteSinkTornLineRemoved(); },
        reportProblem, [](const std::string&) { QVReportingStats::shared().noteFileRefused(); }};
    // Disk budgets: the sinks' closed segments, the summary files and the stack samples.
    const auto logsAudio = device.diagnosticLogsDirectory() / "Audio";
    const auto sinkSegments = SinkSegmentPolicy{
        options->sinkSegmentBytes, options->sinkSegmentSeconds,
        std::make_shared<DiskBudget>(
            "sinks", options->sinksMaxBytes,
            DiskBudget::closedSinkSegmentsIn(std::filesystem::path(options->stateDir) / "sinks"),
            DiskBudget::Callbacks{[](std::string_view sink, std::uint64_t bytes) {
                                      QVReportingStats::shared().noteSinkBytesExpired(sink, bytes);
                                  },
                                  reportProblem})};
    const auto logBudget = [&](const char* dir, const char* group, std::uint64_t maxBytes) {
        return std::make_shared<DiskBudget>(
            (std::filesystem::path("logs/Audio") / dir).string(), maxBytes,
            DiskBudget::filesIn(logsAudio / dir, group),
            DiskBudget::Callbacks{[](std::string_view group, std::uint64_t bytes) {
                                      QVReportingStats::shared().noteLogBytesExpired(group, bytes);
                                  },
                                  reportProblem});
    };
    const std::shared_ptr<DiskBudget> logBudgets[] = {
        logBudget("Reporting", "reporting", options->reportingMaxBytes),
        logBudget("Spinlogs", "spinlogs", options->spinlogsMaxBytes)};
    // A budget lowered since the last run applies at once.
    sinkSegments.closedSegments->enforce();
    const auto enforceLogBudgets = [&logBudgets] {
        for (const auto& budget : logBudgets) {
            budget->enforce();
        }
    };
    enforceLogBudgets();
    auto analytics = LinuxAnalyticsService::create(
        options->stateDir, clock, options->analyticsEventsFile, sinkCallbacks, sinkSegments);
    if (!analytics.service) {
        QVLOG_ERROR(QVReportingServiceDelegateCategory(), "{}", analytics.error);
        return 1;
    }
    LinuxSystemCondition condition;
    LinuxConvoService convo(preferences,
                            std::make_unique<JsonlSink>(
                                options->stateDir, std::string(LinuxConvoService::kSinkName), clock,
                                sinkCallbacks, JsonlSink::kDefaultCapacity, sinkSegments));
    // BlueZ is followed on a thread of the facility's own; a bus that cannot be reached now only
    // leaves Bluetooth unavailable until it can.
    LinuxBluetoothFacility bluetooth(
        options->bluezBus, options->accessoryDir,
        [](LinuxBluetoothFacility::LogLevel level, const std::string& line) {
            switch (level) {
                case LinuxBluetoothFacility::LogLevel::Info:
                    QVLOG_INFO(QVReportingAudioRegistrationCategory(), "{}", line);
                    break;
                case LinuxBluetoothFacility::LogLevel::Default:
                    QVLOG_DEFAULT(QVReportingAudioRegistrationCategory(), "{}", line);
                    break;
                case LinuxBluetoothFacility::LogLevel::Error:
                    QVLOG_ERROR(QVReportingAudioRegistrationCategory(), "{}", line);
                    break;
            }
        },
        [] { QVReportingStats::shared().noteFileRefused(); });
    LinuxIssueCaptureService issueCapture(
        clock, preferences,
        std::make_unique<JsonlSink>(options->stateDir,
                                    std::string(LinuxIssueCaptureService::kSinkName), clock,
                                    sinkCallbacks, JsonlSink::kDefaultCapacity, sinkSegments),
        LinuxIssueCaptureService::Options{
            (device.diagnosticLogsDirectory() / "Audio" / "Captures").string(),
            options->journalDir.empty() ? std::nullopt
                                        : std::optional<std::string>(options->journalDir),
            process.ownProcessIdentifier()},
        LinuxIssueCaptureService::Callbacks{[](std::string_view reason) {
                                                QVReportingStats::shared().noteIssueCaptureRefused(
                                                    reason);
                                            },
                                            reportProblem});
    LinuxIssueFilerService issueFiler(
        std::make_unique<JsonlSink>(options->stateDir,
                                    std::string(LinuxIssueFilerService::kSinkName), clock,
                                    sinkCallbacks, JsonlSink::kDefaultCapacity, sinkSegments),
        LinuxIssueFilerService::Options{
            .sessionBusAddress = LinuxIssueFilerService::sessionBusAddressFor(
                std::getenv("DBUS_SESSION_BUS_ADDRESS"), ::geteuid()),
            .notice = [](const std::string& message) {
                QVLOG_DEFAULT(QVReportingSessionCategory(), "{}", message);
            }});
    LinuxDiagnosticRequestService diagnostics(
        clock,
        std::make_unique<JsonlSink>(options->stateDir,
                                    std::string(LinuxDiagnosticRequestService::kSinkName), clock,
                                    sinkCallbacks, JsonlSink::kDefaultCapacity, sinkSegments),
        LinuxDiagnosticRequestService::Options{
            .spinlogsDirectory = device.diagnosticLogsDirectory() / "Audio" / "Spinlogs",
            .notice = [](const std::string& message) {
                QVLOG_DEFAULT(QVReportingPulsarLogCategory(), "{}", message);
            }});
    LinuxSpanTraceRecorder::Options traceOptions;
    traceOptions.traceDirectory = device.diagnosticLogsDirectory() / "Audio" / "Traces" / "raw";
    traceOptions.tracefsRoot = options->tracefsRoot;
    LinuxSpanTraceRecorder spanTrace(std::move(traceOptions), [](const std::string& message) {
        QVLOG_ERROR(QVReportingTraceCategory(), "{}", message);
    });
    LinuxThreadlineModelReader threadline;
    LinuxGaugeDataWriter gaugeData;

    LinuxStatFeed statFeed(options->sysfsRoot, clock);
    LinuxProcessLauncher processLauncher;

    LinuxMTXMetricsService mtx(std::make_unique<JsonlSink>(
        options->stateDir, std::string(LinuxMTXMetricsService::kSinkName), clock, sinkCallbacks,
        JsonlSink::kDefaultCapacity, sinkSegments));
    LinuxEnergyLogService energyLog(std::make_unique<JsonlSink>(
        options->stateDir, std::string(LinuxEnergyLogService::kSinkName), clock, sinkCallbacks,
        JsonlSink::kDefaultCapacity, sinkSegments));

    LinuxTaskExecutor executor;

    const Platform platform{
        clock,     device,     process,   preferences,  notifications,   *analytics.service,
        condition, convo,      bluetooth, issueCapture, issueFiler,      diagnostics,
        spanTrace, threadline, gaugeData, statFeed,     processLauncher, mtx,
        energyLog, executor};

    QVReportingWorkerRegistry::setAllWorkerClasses(QVReportingAllWorkerClasses());
    SerialQueue& queue = QVReportingUtilityGetReportingServerQueue();
    QVReportingSystemMonitor::initializeWithQueue(queue, platform);
    QVReportingService service(platform, queue, options->limits);

    std::unique_ptr<QVReportingDirectSocket> direct;
    try {
        if (!options->directSocket.empty()) {
            direct = QVReportingDirectSocket::listen(options->directSocket);
        }
    } catch (const std::runtime_error& e) {
        QVLOG_ERROR(QVReportingServiceDelegateCategory(),
                    "cannot listen for direct connections: {}", e.what());
        return 1;
    }
    std::unique_ptr<QVReportingDBusServer> server;
    try {
        server = std::make_unique<QVReportingDBusServer>(connectTo(options->bus), service,
                                                         &notifications, std::move(direct));
        server->start();
    } catch (const std::runtime_error& e) {
        QVLOG_ERROR(QVReportingServiceDelegateCategory(), "cannot serve on the {} bus: {}",
                    options->bus, e.what());
        return 1;
    }

    RepeatingTimer memoryReturn(std::chrono::seconds(5), returnFreeMemory);
    RepeatingTimer logBudgetCheck(kLogBudgetInterval, enforceLogBudgets);

    int signal = 0;
    sigwait(&stopSignals, &signal);
    QVLOG_DEFAULT(QVReportingServiceDelegateCategory(), "stopping on {}: stopping every session",
                  strsignal(signal));
    // Sessions stop first so their workers flush into the sinks; then held replies go out, and
    // the sinks and the log are written through before the process leaves.
    service.stopAllSessions();
    server->flush();
    server->stop();
    // Work the bus posted before it closed (a client leaving, a call still queued) runs while
    // the service, its sessions and the server it answers through still exist.
    queue.sync([] {});
    // Work the sessions left on the pool (the Convo summaries and flushes) goes into the sinks
    // before they are flushed.
    if (!executor.waitUntilIdle(kPoolDrainTimeout)) {
        QVLOG_ERROR(QVReportingServiceDelegateCategory(),
                    "background work still running after {} s; leaving anyway",
                    std::chrono::duration<double>(kPoolDrainTimeout).count());
    }
    server.reset();
    JsonlSink::flushAll(std::chrono::steady_clock::now() + kShutdownFlushTimeout);
    QVReportingSystemMonitor::reset();
    QVLOG_DEFAULT(QVReportingServiceDelegateCategory(), "stopped");
    if (auto sink = logSink()) {
        sink->flush();
    }
    return 0;
}
