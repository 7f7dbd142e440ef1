#include "workers/diagnostics/QVReportingSessionPulsarWorker.h"

#include <atomic>
#include <cmath>
#include <mutex>
#include <thread>

#include "platform/Clock.h"
#include "platform/DiagnosticRequestService.h"
#include "platform/NotificationCenter.h"
#include "platform/PreferenceStore.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingUtility.h"

namespace qv {

namespace {

// A payload value read as an integer; an absent one reads 0.
std::int64_t integerValue(const Value* value) {
    return value ? value->longLongValue() : 0;
}

constexpr std::string_view kSmallestBufferFrameSizeKey = "smallest_buffer_frame_size";
constexpr std::string_view kPayloadIOCycleKey = "io_cycle";
constexpr std::string_view kRequestDomain = "com.korvane.qvsound";
constexpr std::string_view kRequestKind = "AudioOverloads";
// The request's five options, in order: 1, 1, 0, 0, 0.
constexpr DiagnosticRequestOptions kRequestOptions{.sampleStacks = true,
                                                   .callGraphs = true,
                                                   .extendedWindow = false,
                                                   .userSpaceOnly = false,
                                                   .skipReport = false};

// Workers are made on the server queue, but the settings may be read anywhere: a small lock
// keeps the four values consistent with each other.
std::mutex gSettingsMutex;
QVReportingSessionPulsarWorker::Settings gSettings;  // guarded by gSettingsMutex

std::mutex gPauseMutex;
QVReportingSessionPulsarWorker::Pause gPause;  // guarded by gPauseMutex; empty: the real sleep

void pauseFor(std::chrono::microseconds duration) {
    QVReportingSessionPulsarWorker::Pause pause;
    {
        std::lock_guard lock(gPauseMutex);
        pause = gPause;
    }
    if (pause) {
        pause(duration);
    } else if (duration.count() > 0) {
        std::this_thread::sleep_for(duration);
    }
}

// The pause in whole microseconds: negative and NaN give none, more than the guardrail its cap.
std::uint64_t waitMicroseconds(double waitTime) {
    if (!(waitTime > 0)) {
        return 0;
    }
    if (waitTime >= static_cast<double>(QVReportingSessionPulsarWorker::kMaximumWaitMicroseconds)) {
        return QVReportingSessionPulsarWorker::kMaximumWaitMicroseconds;
    }
    return static_cast<std::uint64_t>(waitTime);
}

}  // namespace

std::shared_ptr<QVReportingSessionPulsarWorker> QVReportingSessionPulsarWorker::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    if (!session) {
        return nullptr;
    }
    const Platform& platform = session->platform();
    const bool enabled = getEnableFlag(platform.preferences, kEnableKey);
    if (!enabled || !QVReportingUtilityIsInternalBuild(platform)) {
        return nullptr;
    }
    auto worker = std::make_shared<QVReportingSessionPulsarWorker>(
        platform.clock, platform.diagnostics, platform.notifications);
    worker->setSession(session);
    readSettings(platform.preferences);
    return worker;
}

void QVReportingSessionPulsarWorker::readSettings(const PreferenceStore& defaults) {
    Settings s;
    s.ioBufferSize = getRunTimeDefaults(defaults, kIOBufferSizeKey);
    if (s.ioBufferSize == 0) {
        s.ioBufferSize = kDefaultIOBufferSize;
    }
    s.ioCycle = getRunTimeDefaults(defaults, kIOCycleKey);
    s.waitTime = getDoubleRunTimeDefaults(defaults, kWaitTimeKey);
    s.waitMicroseconds = waitMicroseconds(s.waitTime);
    if (s.waitMicroseconds == kMaximumWaitMicroseconds && s.waitTime != kMaximumWaitMicroseconds) {
        QVLOG_DEFAULT(QVReportingPulsarLogCategory(),
                      "{} of {} microseconds capped at {}: a longer pause would hold up every "
                      "session's messages",
                      kWaitTimeKey, s.waitTime, kMaximumWaitMicroseconds);
    }
    std::lock_guard lock(gSettingsMutex);
    gSettings = s;
}

bool QVReportingSessionPulsarWorker::getEnableFlag(const PreferenceStore& defaults,
                                                   std::string_view key) {
    const auto value = defaults.value(kDefaultsSuite, key);
    if (!value) {
        return false;
    }
    QVLOG_DEBUG(QVReportingPulsarLogCategory(), "Value of {} is {}", key,
                QVReportingValueText(&*value));
    return value->boolValue();
}

std::int32_t QVReportingSessionPulsarWorker::getRunTimeDefaults(const PreferenceStore& defaults,
                                                                std::string_view key) {
    const auto value = defaults.value(kDefaultsSuite, key);
    if (!value) {
        return 0;
    }
    QVLOG_DEBUG(QVReportingPulsarLogCategory(), "Value of {} is {}", key,
                QVReportingValueText(&*value));
    return value->intValue();
}

double QVReportingSessionPulsarWorker::getDoubleRunTimeDefaults(const PreferenceStore& defaults,
                                                                std::string_view key) {
    const auto value = defaults.value(kDefaultsSuite, key);
    if (!value) {
        return 0.0;
    }
    QVLOG_DEBUG(QVReportingPulsarLogCategory(), "Value of {} is {}", key,
                QVReportingValueText(&*value));
    return value->doubleValue();
}

QVReportingSessionPulsarWorker::Settings QVReportingSessionPulsarWorker::settings() {
    std::lock_guard lock(gSettingsMutex);
    return gSettings;
}

bool QVReportingSessionPulsarWorker::interestedInMessage(
    const QVReportingSessionMessage& message) const {
    if (message.type() == type::kError && message.category() == category::kIO) {
        QVLOG_INFO(QVReportingPulsarLogCategory(), "Interested in overload");
        return true;
    }
    return false;
}

void QVReportingSessionPulsarWorker::handleMessage(
    const std::shared_ptr<QVReportingSessionMessage>& message) {
    if (!message || !interestedInMessage(*message)) {
        return;
    }
    const double now = clock_.now();
    const Settings current = settings();
    const Dictionary& payload = message->message();
    if (integerValue(payload.find(kSmallestBufferFrameSizeKey)) < current.ioBufferSize) {
        return;
    }
    if (lastMessageTime_ != 0.0 && !(now - lastMessageTime_ > kMinimumRequestSpacingSeconds)) {
        return;
    }
    if (integerValue(payload.find(kPayloadIOCycleKey)) < current.ioCycle) {
        return;
    }
    pauseFor(std::chrono::microseconds(current.waitMicroseconds));

    // Deep, so that nothing the service keeps shares a container with the session's message.
    Value copied = Value(payload).deepCopy();
    const Dictionary& copy = *copied.asDictionary();
    QVLOG_INFO(QVReportingPulsarLogCategory(), "Dropping spinlog {}", copy.description());
    const std::string description = QVReportingValueText(payload.find(QVReportingApplicationName));
    diagnostics_.request(kRequestDomain, kRequestKind, description, copy, kRequestOptions);
    // A plain post: the name's state stays what it was; observers hear of the drop.
    notifications_.post(kDroppedSpinlogNotification,
                        notifications_.stateOf(kDroppedSpinlogNotification));
    QVLOG_INFO(QVReportingPulsarLogCategory(), "Dropped spinlog");
    lastMessageTime_ = now;
}

void QVReportingSessionPulsarWorker::TEST_setPause(Pause pause) {
    std::lock_guard lock(gPauseMutex);
    gPause = std::move(pause);
}

void QVReportingSessionPulsarWorker::TEST_resetSettings() {
    std::lock_guard lock(gSettingsMutex);
    gSettings = Settings{};
}

}  // namespace qv
