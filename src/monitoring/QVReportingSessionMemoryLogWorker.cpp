#include "monitoring/QVReportingSessionMemoryLogWorker.h"

#include <algorithm>
#include <future>
#include <mutex>
#include <optional>
#include <system_error>
#include <thread>

#include "platform/Clock.h"
#include "platform/PreferenceStore.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingStats.h"
#include "session/QVReportingUtility.h"
#include "session/QVReportingVocabulary.h"

namespace qv {

namespace {

constexpr std::string_view kFilterWords[] = {" cpu_time ", " phys_mem ", " wired_mem ",
                                             " phys_footprint ", "RESOURCE"};
constexpr std::string_view kWiredMemoryWord = " wired_mem ";
// A process without wired memory: not worth a line.
constexpr std::string_view kNoWiredMemory =
    "wired_mem          0           0           0        none";

// Settings' bounds: a tool gets at least a moment and never long enough to stall the queue for
// good; its output is at least a screenful and never more than the log should take.
constexpr double kMinimumTimeoutSeconds = 0.1;
constexpr double kMaximumTimeoutSeconds = 60.0;
constexpr double kMinimumOutputBytes = 4096;
constexpr double kMaximumOutputBytes = 64.0 * 1024 * 1024;
// Time the handler waits beyond a tool's time-out for its thread to kill, reap and deliver.
constexpr std::chrono::seconds kDeliveryGrace{2};

constexpr std::string_view kStatsSink = "memorylog";

std::mutex gRateMutex;
std::optional<std::chrono::steady_clock::time_point> gLastCapture;  // guarded by gRateMutex

struct CaptureTask {
    std::string command;
    bool filtered = false;
    ProcessPipeLimits limits;
    ProcessLauncher* launcher = nullptr;
    std::promise<std::string> result;
};

// Kept lines go to the log: a NUL would end a journal message early and other control bytes
// garble a terminal, so they become '?'.
void appendLine(std::string& text, std::string_view line) {
    for (const char c : line) {
        const auto u = static_cast<unsigned char>(c);
        text.push_back((u < 0x20 && c != '\n' && c != '\t') || u == 0x7F ? '?' : c);
    }
    if (text.empty() || text.back() != '\n') {
        text.push_back('\n');
    }
}

void runCapture(CaptureTask& task) {
    const auto& log = QVReportingProcessDefaultLog();
    const auto prefix = QVReportingSessionMemoryLogWorker::kLogPrefix;
    QVLOG_ERROR(log, "{} requesting '{}'", prefix, task.command);
    std::string text;
    bool executed = false;
    {
        auto launched = task.launcher->launch(task.command, task.limits);
        if (launched.pipe) {
            while (auto line = launched.pipe->readLine()) {
                if (!task.filtered || QVReportingSessionMemoryLogWorker::lineIsKept(*line)) {
                    appendLine(text, *line);
                }
            }
            const ProcessPipe::Outcome outcome = launched.pipe->close();
            executed = outcome.ending != ProcessPipe::Ending::NotExecutable;
            if (outcome.ending == ProcessPipe::Ending::TimedOut ||
                outcome.ending == ProcessPipe::Ending::Truncated) {
                QVLOG_ERROR(
                    log, "{} request '{}' cut short: {}", prefix, task.command,
                    outcome.ending == ProcessPipe::Ending::TimedOut ? "time-out" : "output limit");
                QVReportingStats::shared().noteSinkLineLost(kStatsSink);
            }
        }
    }
    if (!executed) {
        QVLOG_ERROR(log, "{} unable to execute '{}'", prefix, task.command);
        task.result.set_value(std::string());
        return;
    }
    QVLOG_ERROR(log, "{} request {} captured", prefix, task.command);
    task.result.set_value(std::move(text));
}

std::optional<double> numberSetting(const PreferenceStore& preferences, std::string_view key) {
    const auto value = preferences.value(QVReportingMemoryLogSuite, key);
    if (!value || value->kind() == Value::Kind::Bool) {
        return std::nullopt;
    }
    return value->asDouble();
}

}  // namespace

const QVReportingLogCategory& QVReportingProcessDefaultLog() {
    static const QVReportingLogCategory category{"default"};
    return category;
}

std::shared_ptr<QVReportingSessionMemoryLogWorker>
QVReportingSessionMemoryLogWorker::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    if (!session) {
        return nullptr;
    }
    const Platform& platform = session->platform();
    if (session->serviceType() != service::kTest && !QVReportingUtilityIsInternalBuild(platform)) {
        return nullptr;
    }
    auto worker = std::make_shared<QVReportingSessionMemoryLogWorker>(
        platform.clock, platform.preferences, platform.processLauncher);
    worker->setSession(session);
    return worker;
}

QVReportingSessionMemoryLogWorker::Settings QVReportingSessionMemoryLogWorker::readSettings(
    const PreferenceStore& preferences) {
    Settings settings;
    const std::string_view keys[] = {QVReportingMemoryLogKeyProcessCommand,
                                     QVReportingMemoryLogKeyKernelCommand};
    const std::string_view defaults[] = {kDefaultProcessCommand, kDefaultKernelCommand};
    for (int i = 0; i < 2; ++i) {
        const auto value = preferences.value(QVReportingMemoryLogSuite, keys[i]);
        const std::string* command = value ? value->asString() : nullptr;
        settings.commands[i] = command && !command->empty() ? *command : std::string(defaults[i]);
    }
    if (const auto seconds = numberSetting(preferences, QVReportingMemoryLogKeyTimeoutSeconds)) {
        const double clamped = std::clamp(*seconds, kMinimumTimeoutSeconds, kMaximumTimeoutSeconds);
        settings.limits.timeout = std::chrono::milliseconds(static_cast<long>(clamped * 1000));
    }
    if (const auto bytes = numberSetting(preferences, QVReportingMemoryLogKeyMaxOutputBytes)) {
        settings.limits.maxOutputBytes =
            static_cast<std::size_t>(std::clamp(*bytes, kMinimumOutputBytes, kMaximumOutputBytes));
    }
    return settings;
}

bool QVReportingSessionMemoryLogWorker::lineIsKept(std::string_view line) {
    for (const std::string_view word : kFilterWords) {
        if (line.find(word) == std::string_view::npos) {
            continue;
        }
        return !(word == kWiredMemoryWord && line.find(kNoWiredMemory) != std::string_view::npos);
    }
    return false;
}

std::vector<std::string_view> QVReportingSessionMemoryLogWorker::cutIntoBlocks(
    std::string_view text) {
    std::vector<std::string_view> blocks;
    while (text.size() >= kBlockBytes) {
        const std::size_t eol = text.find('\n', kBlockBytes - 1);
        const std::size_t length = eol == std::string_view::npos ? kBlockBytes : eol + 1;
        blocks.push_back(text.substr(0, length));
        text.remove_prefix(length);
    }
    if (!text.empty()) {
        blocks.push_back(text);
    }
    return blocks;
}

void QVReportingSessionMemoryLogWorker::logCapturedText(std::string_view text) {
    std::size_t number = 0;
    for (const std::string_view block : cutIntoBlocks(text)) {
        QVLOG_ERROR(QVReportingProcessDefaultLog(), "WIRED LOG BLOCK {}\n{}", ++number, block);
    }
}

bool QVReportingSessionMemoryLogWorker::rateLimitPasses(const Clock& clock) {
    const auto now = clock.steadyNow();
    std::lock_guard lock(gRateMutex);
    // The first request passes: before it, the last capture counts as made long enough ago.
    if (gLastCapture && now - *gLastCapture <= kMinimumInterval) {
        return false;
    }
    gLastCapture = now;
    return true;
}

void QVReportingSessionMemoryLogWorker::TEST_resetRateLimit() {
    std::lock_guard lock(gRateMutex);
    gLastCapture.reset();
}

void QVReportingSessionMemoryLogWorker::handleMessage(
    const std::shared_ptr<QVReportingSessionMessage>& message) {
    if (!message || message->type() != type::kMemoryLog) {
        return;
    }
    if (!rateLimitPasses(clock_)) {
        return;
    }
    const Settings settings = readSettings(preferences_);
    const auto deadline =
        std::chrono::steady_clock::now() + settings.limits.timeout + kDeliveryGrace;
    std::future<std::string> texts[2];
    for (int i = 0; i < 2; ++i) {
        auto task = std::make_shared<CaptureTask>();
        task->command = settings.commands[i];
        task->filtered = i == 0;
        task->limits = settings.limits;
        task->launcher = &launcher_;
        texts[i] = task->result.get_future();
        try {
            std::thread([task] { runCapture(*task); }).detach();
        } catch (const std::system_error& e) {
            QVLOG_ERROR(QVReportingProcessDefaultLog(), "{} unable to execute '{}': {}", kLogPrefix,
                        settings.commands[i], e.what());
            texts[i] = {};
        }
    }
    for (int i = 0; i < 2; ++i) {
        if (!texts[i].valid()) {
            continue;
        }
        if (texts[i].wait_until(deadline) != std::future_status::ready) {
            // The thread is stuck past killing its tool (a process that cannot die): leave it.
            QVLOG_ERROR(QVReportingProcessDefaultLog(), "{} request {} not delivered in time",
                        kLogPrefix, settings.commands[i]);
            QVReportingStats::shared().noteSinkLineLost(kStatsSink);
            continue;
        }
        logCapturedText(texts[i].get());
    }
}

}  // namespace qv
