// qvreportd: the composition root. Builds the platform from its Linux implementations, hands the
// worker table to the registry, starts the system monitor and the service, serves D-Bus, and on
// SIGTERM or SIGINT stops every session (so workers flush) before leaving.
#include <malloc.h>
#include <signal.h>
#include <sys/stat.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <memory>

#include <sdbus-c++/sdbus-c++.h>

#include "monitoring/QVReportingSystemMonitor.h"
#include "platform/linux/LinuxAnalyticsService.h"
#include "platform/linux/LinuxClock.h"
#include "platform/linux/LinuxConvoService.h"
#include "platform/linux/LinuxDeviceInformation.h"
#include "platform/linux/LinuxNotificationCenter.h"
#include "platform/linux/LinuxPreferenceStore.h"
#include "platform/linux/LinuxProcessInfo.h"
#include "platform/linux/LinuxSystemCondition.h"
#include "platform/linux/LinuxTaskExecutor.h"
#include "service/QVReportingDBusServer.h"
#include "service/QVReportingDaemonOptions.h"
#include "service/QVReportingService.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingStats.h"
#include "session/QVReportingWorkerRegistry.h"
#include "session/RepeatingTimer.h"
#include "session/SerialQueue.h"
#include "workers/QVReportingWorkerClasses.h"

namespace {

using namespace qv;

const QVReportingLogCategory& logCategory() {
    return QVReportingServiceDelegateCategory();
}

std::unique_ptr<sdbus::IConnection> connectTo(const std::string& bus) {
    if (bus == "system") {
        return sdbus::createSystemBusConnection();
    }
    if (bus == "session") {
        return sdbus::createSessionBusConnection();
    }
    return sdbus::createSessionBusConnectionWithAddress(bus);
}

// Stopped sessions free their messages in bulk, but the allocator keeps freed pages inside its
// arenas. Once this much lies free, it is handed back to the system, so that the daemon's
// footprint follows its load instead of its busiest moment.
constexpr std::size_t kFreeBytesWorthReturning = 1u << 20;

// How long a stop waits for the pool's work: the longest wait a worker starts there (the Convo
// worker's 9 s for backends) with a margin, inside the 10 s a stop may take.
constexpr std::chrono::milliseconds kPoolDrainTimeout{9500};

void returnFreeMemory() {
    if (mallinfo2().fordblks > kFreeBytesWorthReturning) {
        malloc_trim(0);
    }
}

}  // namespace

int main(int argc, char** argv) {
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

    std::error_code ec;
    std::filesystem::create_directories(options->stateDir, ec);
    if (ec) {
        QVLOG_ERROR(logCategory(), "cannot create the state directory {}: {}", options->stateDir,
                    ec.message());
        return 1;
    }

    auto reportProblem = [](const std::string& message) {
        QVLOG_ERROR(logCategory(), "{}", message);
    };
    LinuxClock clock;
    LinuxDeviceInformation device(options->deviceFile,
                                  std::filesystem::path(options->stateDir) / "logs",
                                  options->internalBuild);
    if (!device.loadError().empty()) {
        QVLOG_ERROR(logCategory(), "device file ignored: {}", device.loadError());
    }
    LinuxProcessInfo process;
    LinuxPreferenceStore preferences(options->stateDir, reportProblem);
    LinuxNotificationCenter notifications;
    const SinkCallbacks sinkCallbacks{
        [](std::string_view sink) { QVReportingStats::shared().noteSinkLineLost(sink); },
        reportProblem};
    auto analytics = LinuxAnalyticsService::create(options->stateDir, clock,
                                                   options->analyticsEventsFile, sinkCallbacks);
    if (!analytics.service) {
        QVLOG_ERROR(logCategory(), "{}", analytics.error);
        return 1;
    }
    LinuxSystemCondition condition;
    LinuxConvoService convo(
        preferences,
        std::make_unique<JsonlSink>(options->stateDir, std::string(LinuxConvoService::kSinkName),
                                    clock, sinkCallbacks));
    LinuxTaskExecutor executor;
    const Platform platform{clock,       device,        process,
                            preferences, notifications, *analytics.service,
                            condition,   convo,         executor};

    QVReportingWorkerRegistry::setAllWorkerClasses(QVReportingAllWorkerClasses());
    SerialQueue& queue = QVReportingUtilityGetReportingServerQueue();
    QVReportingSystemMonitor::initializeWithQueue(queue, platform);
    QVReportingService service(platform, queue, options->limits);

    std::unique_ptr<QVReportingDBusServer> server;
    try {
        server = std::make_unique<QVReportingDBusServer>(connectTo(options->bus), service,
                                                         &notifications);
        server->start();
    } catch (const sdbus::Error& e) {
        QVLOG_ERROR(logCategory(), "cannot serve on the {} bus: {} {}", options->bus, e.getName(),
                    e.getMessage());
        return 1;
    }

    RepeatingTimer memoryReturn(std::chrono::seconds(5), returnFreeMemory);

    int signal = 0;
    sigwait(&stopSignals, &signal);
    QVLOG_DEFAULT(logCategory(), "stopping on {}: stopping every session", strsignal(signal));
    // Sessions stop first so their workers flush into the sinks; then held replies go out, and
    // the sinks and the log are written through before the process leaves.
    service.stopAllSessions();
    server->flush();
    server.reset();
    // Work the sessions left on the pool (the Convo summaries and flushes) goes into the sinks
    // before they are flushed; a Convo wait for backends ends within its 9 s.
    if (!executor.waitUntilIdle(kPoolDrainTimeout)) {
        QVLOG_ERROR(logCategory(), "background work still running after {} s; leaving anyway",
                    std::chrono::duration<double>(kPoolDrainTimeout).count());
    }
    analytics.service->flush();
    convo.flush();
    QVReportingSystemMonitor::reset();
    QVLOG_DEFAULT(logCategory(), "stopped");
    if (auto sink = logSink()) {
        sink->flush();
    }
    return 0;
}
