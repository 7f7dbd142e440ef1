#include "workers/backends/QVReportingSessionAudioRegistrationWorker.h"

#include <time.h>

#include <cmath>
#include <random>
#include <stdexcept>

#include <fmt/format.h>

#include "platform/Clock.h"
#include "platform/ConvoService.h"
#include "platform/PreferenceStore.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingUtility.h"
#include "workers/backends/BTAccess.h"

namespace qv {

namespace {

using Worker = QVReportingSessionAudioRegistrationWorker;

constexpr double kSecondsPerDay = 86400;
constexpr const char* kSetupTaskName =
    "-[QVReportingSessionAudioRegistrationWorker setupConvoReporterInterface:]";

// What every session of the process shares.
struct SharedState {
    // The process-wide lock of the gathering: one BTAccess serves every session.
    std::mutex gatherMutex;
    std::unique_ptr<BTAccess> btAccess;  // guarded by gatherMutex

    std::mutex mutex;
    bool loaded = false;                             // guarded by mutex
    Dictionary registrationInfo;                     // guarded by mutex
    double nextEnumerationEpoch = 0;                 // guarded by mutex; 0 = not loaded
    double nextInvocationEpoch = 0;                  // guarded by mutex; 0 = not loaded
    Worker::RandomSource randomSource;               // guarded by mutex; empty = the default
    std::mt19937 generator{std::random_device{}()};  // guarded by mutex
};

SharedState& shared() {
    static SharedState state;
    return state;
}

double storedDouble(const PreferenceStore& defaults, std::string_view key) {
    const auto v = defaults.value(Worker::kSuite, key);
    return v ? v->doubleValue() : 0.0;
}

// A value as an unsigned 32-bit number: whole seconds, wrapped as a 32-bit store would; 0 when
// absent. Anything but a number is refused.
std::uint32_t unsignedIntValue(const Value* v) {
    if (!v) {
        return 0;
    }
    const auto k = v->kind();
    if (k == Value::Kind::Int || k == Value::Kind::UInt || k == Value::Kind::Bool) {
        if (auto u = v->asUInt64()) {
            return static_cast<std::uint32_t>(*u);
        }
        return static_cast<std::uint32_t>(v->asInt64().value_or(0));
    }
    if (k == Value::Kind::Double) {
        const double d = *v->asDouble();
        if (!std::isfinite(d) || std::fabs(d) >= 9.2e18) {
            return 0;
        }
        return static_cast<std::uint32_t>(static_cast<std::int64_t>(d));
    }
    throw std::runtime_error(
        fmt::format("lastConnectedEpoch is not a number: {}", v->description()));
}

bool isLeapYear(int year) {
    return (year % 4 == 0 && year % 100 != 0) || year % 400 == 0;
}

}  // namespace

std::shared_ptr<Worker> Worker::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    if (!session) {
        return nullptr;
    }
    QVLOG_DEBUG(QVReportingAudioRegistrationCategory(),
                "QVReportingService Audio Registration initWithSession");
    auto worker = std::make_shared<Worker>(session->platform());
    worker->setSession(session);
    worker->setStarted(false);
    worker->loadSharedState();
    return worker;
}

void Worker::loadSharedState() {
    SharedState& s = shared();
    std::lock_guard lock(s.mutex);
    if (s.loaded) {
        return;
    }
    s.loaded = true;
    PreferenceStore& defaults = platform_.preferences;
    const auto stored = defaults.value(kSuite, kRegistrationInfoKey);
    if (stored && stored->asDictionary()) {
        s.registrationInfo = *stored->asDictionary();
        return;
    }
    QVLOG_DEBUG(QVReportingAudioRegistrationCategory(), "Set RegistrationInfo Defaults");
    s.registrationInfo.clear();
    defaults.setValue(kSuite, kRegistrationInfoKey, Dictionary{});
}

void Worker::TEST_resetSharedState() {
    SharedState& s = shared();
    {
        std::lock_guard gather(s.gatherMutex);
        s.btAccess.reset();
    }
    std::lock_guard lock(s.mutex);
    s.loaded = false;
    s.registrationInfo.clear();
    s.nextEnumerationEpoch = 0;
    s.nextInvocationEpoch = 0;
}

void Worker::TEST_setRandomSource(RandomSource source) {
    SharedState& s = shared();
    std::lock_guard lock(s.mutex);
    s.randomSource = std::move(source);
}

bool Worker::start() {
    QVLOG_DEFAULT(QVReportingAudioRegistrationCategory(),
                  "Starting QVReportingSessionAudioRegistrationWorker");
    setStarted(true);
    return true;
}

void Worker::handleMessage(const std::shared_ptr<QVReportingSessionMessage>& message) {
    if (!message) {
        return;
    }
    const Value* devices = message->message().find(kActiveDevicesKey);
    if (!devices || QVReportingValueText(devices).find(kTrigger) == std::string::npos) {
        return;
    }
    SharedState& s = shared();
    try {
        const Clock& clock = platform_.clock;
        const double now = clock.now();
        double next = 0;
        {
            std::lock_guard lock(s.mutex);
            if (s.nextEnumerationEpoch == 0) {
                s.nextEnumerationEpoch =
                    storedDouble(platform_.preferences, kEnumerationCheckEpochKey);
                if (s.nextEnumerationEpoch == 0) {
                    s.nextEnumerationEpoch = now;
                }
            }
            next = s.nextEnumerationEpoch;
        }
        QVLOG_DEBUG(QVReportingAudioRegistrationCategory(),
                    "Time to next BT Enumeration: {:f} seconds / {:f} days", next - now,
                    (next - now) / kSecondsPerDay);
        if (now < next) {
            return;
        }
        std::lock_guard gather(s.gatherMutex);
        if (!s.btAccess) {
            s.btAccess = std::make_unique<BTAccess>(platform_);
        }
        Dictionary result = s.btAccess->gatherData();
        const double newNext = clock.now() + kGatheringInterval;
        {
            std::lock_guard lock(s.mutex);
            s.registrationInfo = result;
            s.nextEnumerationEpoch = newNext;
        }
        platform_.preferences.setValue(kSuite, kEnumerationCheckEpochKey, newNext);
        platform_.preferences.setValue(kSuite, kRegistrationInfoKey, std::move(result));
    } catch (const std::exception& e) {
        QVLOG_DEBUG(QVReportingAudioRegistrationCategory(), "Exception in BT gatherData : {}",
                    e.what());
    }
}

void Worker::storeNextInvocation(double epoch) {
    {
        SharedState& s = shared();
        std::lock_guard lock(s.mutex);
        s.nextInvocationEpoch = epoch;
    }
    platform_.preferences.setValue(kSuite, kNextInvocationEpochKey, epoch);
}

void Worker::stop() {
    QVLOG_DEFAULT(QVReportingAudioRegistrationCategory(),
                  "Stopping QVReportingSessionAudioRegistrationWorker");
    SharedState& s = shared();
    try {
        Dictionary info;
        double next = 0;
        {
            std::lock_guard lock(s.mutex);
            info = s.registrationInfo;
            next = s.nextInvocationEpoch;
        }
        const Value* splunk = info.find(BaseUnit::kSplunkKey);
        const Array* entries = splunk ? splunk->asArray() : nullptr;
        if (!entries) {
            QVLOG_DEFAULT(QVReportingAudioRegistrationCategory(),
                          "There have been no BT enumerations. Skip further processing");
            return;
        }
        if (next == 0) {
            next = storedDouble(platform_.preferences, kNextInvocationEpochKey);
            std::lock_guard lock(s.mutex);
            s.nextInvocationEpoch = next;
        }
        const double now = platform_.clock.now();
        if (next == 0) {
            std::uint32_t offset = 0;
            {
                std::lock_guard lock(s.mutex);
                if (s.randomSource) {
                    offset = s.randomSource(kFirstPublicationWindow) % kFirstPublicationWindow;
                } else {
                    offset = std::uniform_int_distribution<std::uint32_t>(
                        0, kFirstPublicationWindow - 1)(s.generator);
                }
            }
            next = now + offset;
            storeNextInvocation(next);
            QVLOG_DEFAULT(QVReportingAudioRegistrationCategory(),
                          "Current Epoch: {:f}; nextInvocationEpoch is {:f}", now, next);
            return;
        }
        QVLOG_DEFAULT(QVReportingAudioRegistrationCategory(),
                      "Time to next Invocation: {:f} seconds / {:f} days", next - now,
                      (next - now) / kSecondsPerDay);
        if (now <= next) {
            return;
        }
        QVLOG_DEFAULT(QVReportingAudioRegistrationCategory(), "We could publish");
        storeNextInvocation(now + kRetryInterval);

        Array active;
        for (const Value& item : *entries) {
            const Dictionary* entry = item.asDictionary();
            if (!entry) {
                throw std::runtime_error(fmt::format("a registration entry is not a dictionary: {}",
                                                     item.description()));
            }
            const std::uint32_t last = unsignedIntValue(entry->find(BaseUnit::kLastConnectedEpoch));
            if (now - kActivitySpan <= static_cast<double>(last)) {
                Dictionary published(*entry);
                published.erase(BaseUnit::kLastConnectedEpoch);
                published.set(kLastConnectedWW, _convertEpochToWorkWeek(last));
                active.emplace_back(std::move(published));
            }
        }
        if (!active.empty()) {
            QVLOG_DEFAULT(QVReportingAudioRegistrationCategory(),
                          "At least one active Bud connection detected since last "
                          "publish. Let's publish to Convo!");
            setupConvoReporterInterface(active);
        } else {
            QVLOG_DEFAULT(QVReportingAudioRegistrationCategory(),
                          "No active Bud connections detected since last publish. Skip publishing "
                          "anything; check again after SamplingPeriod");
            storeNextInvocation(platform_.clock.now() + kPublicationInterval);
        }
    } catch (const std::exception& e) {
        QVLOG_DEFAULT(QVReportingAudioRegistrationCategory(),
                      "Exception while trying to process registration info : {}", e.what());
    }
}

void Worker::setupConvoReporterInterface(const Array& devices) {
    QVLOG_DEBUG(QVReportingAudioRegistrationCategory(), "entering convoreporting {}",
                kSetupTaskName);
    ConvoService& convo = platform_.convo;
    auto token = convo.newHierarchyTokenFromParentToken(std::nullopt);
    {
        std::lock_guard lock(convoMutex_);
        convoReportingAgentToken_ = token;
    }
    if (!token) {
        QVLOG_ERROR(QVReportingAudioRegistrationCategory(),
                    "newHierarchyTokenFromParentToken returned nil. Will skip convo for this "
                    "session. {}",
                    kSetupTaskName);
        return;
    }
    const auto owner = session();
    const ReporterID reporterID = owner ? owner->reporterID() : 0;

    Dictionary sessionInfo;
    sessionInfo.set(convo::kSessionInfoClientType, kConvoClientType);
    sessionInfo.set(convo::kSessionInfoClientVersion, std::stof(std::string(kVersionNumber)));
    sessionInfo.set(convo::kSessionInfoSessionID, reporterID);
    sessionInfo.set(convo::kSessionInfoBatchEvent, false);
    sessionInfo.set(convo::kSessionInfoHierarchyToken, *token);
    Dictionary userInfo;
    userInfo.set(convo::kUserInfoClientName, kConvoClientName);
    userInfo.set(convo::kUserInfoServiceName, kConvoServiceName);
    if (owner && !owner->configuration().empty()) {
        userInfo.merge(owner->configuration());
        if (const Value* app = owner->configuration().find(QVReportingApplicationName)) {
            sessionInfo.set(convo::kSessionInfoClientBundleID, *app);
        }
    }

    auto convoSession = convo.createSession(sessionInfo, userInfo, std::nullopt);
    {
        std::lock_guard lock(convoMutex_);
        convoReportingSession_ = convoSession;
    }
    // The callback may come on the service's thread, after this session stopped: it holds the
    // worker and a copy of the entries.
    convoSession->startConfiguration([self = shared_from_this(), devices](
                                         const std::optional<std::vector<std::string>>& backends) {
        if (!backends) {
            QVLOG_ERROR(QVReportingAudioRegistrationCategory(),
                        "no backends found, this session won't get sent to the server");
            self->convoReportingSessionStarted_ = false;
            return;
        }
        self->convoReportingSessionStarted_ = true;
        for (const Value& device : devices) {
            const Dictionary* payload = device.asDictionary();
            if (!payload) {
                continue;
            }
            QVReportingSessionMessage message(*payload, kPublishedCategory, kPublishedType);
            self->_sendMessage(message);
        }
        QVLOG_DEBUG(QVReportingAudioRegistrationCategory(), "Message Sent->");
    });
}

void Worker::_sendMessage(const QVReportingSessionMessage& message) {
    std::shared_ptr<ConvoSession> convoSession;
    {
        std::lock_guard lock(convoMutex_);
        convoSession = convoReportingSession_;
    }
    if (!convoSession) {
        return;
    }
    const auto error =
        convoSession->sendMessage(retrieveConvoReportingCategoryFromCategory(message.category()),
                                  message.type(), message.message());
    if (error) {
        QVLOG_ERROR(QVReportingAudioRegistrationCategory(), "error sending message {}", *error);
        return;
    }
    QVLOG_DEBUG(QVReportingAudioRegistrationCategory(),
                "ConvoReportingAgent {} : message {} : category {} : type {}",
                convoSession->description(), message.message().description(), message.category(),
                message.type());
    storeNextInvocation(platform_.clock.now() + kPublicationInterval);
}

int Worker::_convertEpochToWorkWeek(std::uint32_t epoch) {
    // The zone is read afresh: the device may have moved since the last report.
    ::tzset();
    const time_t t = static_cast<time_t>(epoch);
    tm local{};
    if (!::localtime_r(&t, &local)) {
        throw std::runtime_error(fmt::format("no local time for {}", epoch));
    }
    const int yday = local.tm_yday;
    const int wday = local.tm_wday;  // Sunday is 0
    const int daysInYear = isLeapYear(local.tm_year + 1900) ? 366 : 365;
    // The week that holds 1 January is week 1, even for the December days it holds.
    if (yday + (6 - wday) >= daysInYear) {
        return 1;
    }
    const int firstWeekday = ((wday - yday) % 7 + 7) % 7;  // weekday of 1 January
    return (yday + firstWeekday) / 7 + 1;
}

std::uint16_t Worker::retrieveConvoReportingCategoryFromCategory(AudioEventCategory category) {
    // Prefixed categories are sent by their base category like any other.
    [[maybe_unused]] const bool prefixed = QVReportingUtilityIsABTestModeOn(category);
    return static_cast<std::uint16_t>(category & 0xFFFF);
}

}  // namespace qv
