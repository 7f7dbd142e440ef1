#include "monitoring/QVReportingSystemMonitor.h"

#include <cmath>
#include <utility>

#include "platform/Clock.h"
#include "platform/PreferenceStore.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "session/SerialQueue.h"

namespace qv {

namespace {

std::mutex& singletonMutex() {
    static std::mutex mutex;
    return mutex;
}

// guarded by singletonMutex()
std::shared_ptr<QVReportingSystemMonitor>& singleton() {
    static std::shared_ptr<QVReportingSystemMonitor> monitor;
    return monitor;
}

Dictionary descriptor(std::string_view featureName, std::optional<std::string_view> defaultsDomain,
                      std::string_view notification) {
    Dictionary d;
    if (defaultsDomain) {
        d.set(QVReportingFeatureKeyDefaultsDomain, *defaultsDomain);
    }
    d.set(QVReportingFeatureKeyFeatureDomain, featureName);
    d.set(QVReportingFeatureKeyNotification, notification);
    return d;
}

// The three features, in their declared order.
Dictionary makeFeatures() {
    Dictionary features;
    features.set(QVReportingMessageKeySpatialAudioAccessoryFeature,
                 descriptor(QVReportingMessageKeySpatialAudioAccessoryFeature,
                            QVReportingMessageKeySpatialAudioAccessoryFeatureDomain,
                            QVReportingSpatialAudioAccessoryFeatureChangedNotification));
    features.set(QVReportingMessageKeyDeviceName,
                 descriptor(QVReportingMessageKeyDeviceName, QVReportingDefaultsSuite,
                            QVReportingDefaultsChangedNotification));
    features.set(QVReportingMessageKeyRingerState,
                 descriptor(QVReportingMessageKeyRingerState, std::nullopt,
                            QVReportingRingerStateNotification));
    return features;
}

std::vector<std::string> namesOf(const Dictionary& features) {
    std::vector<std::string> names;
    for (const auto& entry : features) {
        names.push_back(entry.first);
    }
    return names;
}

}  // namespace

Dictionary QVReportingDefaults(const PreferenceStore& preferences) {
    const Dictionary suite = preferences.values(QVReportingDefaultsSuite);
    Dictionary defaults;
    if (const Value* name = suite.find(QVReportingMessageKeyDeviceName); name && name->isString()) {
        defaults.set(QVReportingMessageKeyDeviceName, *name);
    }
    const Value* disable = suite.find(QVReportingMessageKeyDisableReporting);
    defaults.set(QVReportingMessageKeyDisableReporting, disable ? disable->boolValue() : false);
    return defaults;
}

// ---- the one monitor ----

void QVReportingSystemMonitor::initializeWithQueue(SerialQueue& queue, const Platform& platform) {
    std::lock_guard lock(singletonMutex());
    if (!singleton()) {
        singleton() = initWithQueue(queue, platform);
    }
}

std::shared_ptr<QVReportingSystemMonitor> QVReportingSystemMonitor::shared() {
    std::lock_guard lock(singletonMutex());
    return singleton();
}

std::shared_ptr<QVReportingObservedDictionary>
QVReportingSystemMonitor::getSystemMonitorDictionary() {
    const auto monitor = shared();
    return monitor ? monitor->systemMonitorDictionary() : nullptr;
}

std::vector<std::string> QVReportingSystemMonitor::getSystemMonitorKeys() {
    const auto monitor = shared();
    return monitor ? monitor->featureNames() : std::vector<std::string>{};
}

void QVReportingSystemMonitor::reset() {
    std::shared_ptr<QVReportingSystemMonitor> monitor;
    {
        std::lock_guard lock(singletonMutex());
        monitor = std::move(singleton());
    }
    if (monitor) {
        monitor->clear();
    }
}

// ---- one monitor ----

QVReportingSystemMonitor::QVReportingSystemMonitor(SerialQueue& queue, const Platform& platform)
    : platform_(platform),
      queue_(queue),
      defaults_(QVReportingDefaults(platform.preferences)),
      featureNames_(namesOf(makeFeatures())),
      features_(makeFeatures()),
      systemMonitorDictionary_(std::make_shared<QVReportingObservedDictionary>()) {}

std::shared_ptr<QVReportingSystemMonitor> QVReportingSystemMonitor::initWithQueue(
    SerialQueue& queue, const Platform& platform) {
    std::shared_ptr<QVReportingSystemMonitor> monitor(
        new QVReportingSystemMonitor(queue, platform));
    monitor->populateInitialValues();
    monitor->listenForFeatureStateChanges();
    return monitor;
}

QVReportingSystemMonitor::~QVReportingSystemMonitor() {
    clear();
}

Dictionary QVReportingSystemMonitor::features() const {
    std::lock_guard lock(featuresMutex_);
    return features_;
}

std::vector<std::string> QVReportingSystemMonitor::featureNames() const {
    return featureNames_;
}

std::optional<Dictionary> QVReportingSystemMonitor::getFeatureState(std::string_view name) const {
    QVLOG_DEFAULT(QVReportingSessionCategory(), "getting feature {}", name);
    Dictionary descriptor;
    {
        std::lock_guard lock(featuresMutex_);
        const Value* found = features_.find(name);
        if (found == nullptr || found->asDictionary() == nullptr) {
            return std::nullopt;
        }
        descriptor = *found->asDictionary();
    }
    if (!descriptor.contains(QVReportingFeatureKeyFeatureDomain)) {
        return std::nullopt;
    }

    Dictionary state;
    const Value* domain = descriptor.find(QVReportingFeatureKeyDefaultsDomain);
    const Value* token = descriptor.find(QVReportingFeatureKeyNotifyToken);
    if (domain != nullptr && domain->isString()) {
        // The value for the device's user account, any host: on Linux simply the domain's.
        if (auto value = platform_.preferences.value(*domain->asString(), name)) {
            state.set(name, std::move(*value));
        }
    } else if (token != nullptr && token->asInt64()) {
        const auto notifyToken = static_cast<NotificationCenter::Token>(*token->asInt64());
        if (auto value = platform_.notifications.getState(notifyToken)) {
            state.set(name, *value == 1);
        }
    }
    if (state.empty()) {
        return std::nullopt;
    }
    state.set(QVReportingInternalEventEpochTime, platform_.clock.now());
    state.set(QVReportingInternalEventSystemUptimeSec,
              static_cast<std::int64_t>(std::llround(platform_.clock.systemUptime())));
    return state;
}

void QVReportingSystemMonitor::populateInitialValues() {
    QVLOG_INFO(QVReportingSessionCategory(), "populateInitialValues {}", features().description());
    for (const std::string& name : featureNames_) {
        systemMonitorDictionary_->updateValueForKey(name, [&] { return getFeatureState(name); });
    }
}

void QVReportingSystemMonitor::listenForFeatureStateChanges() {
    QVLOG_INFO(QVReportingSessionCategory(), "listening for features {}", features().description());
    const std::weak_ptr<QVReportingSystemMonitor> weakSelf = weak_from_this();
    for (const std::string& name : featureNames_) {
        std::string notification;
        {
            std::lock_guard lock(featuresMutex_);
            const Dictionary* d = features_.find(name)->asDictionary();
            const Value* n = d->find(QVReportingFeatureKeyNotification);
            if (n == nullptr || !n->isString()) {
                continue;
            }
            notification = *n->asString();
        }
        const auto token = platform_.notifications.registerNotification(
            notification,
            [queue = &queue_](std::function<void()> task) { queue->async(std::move(task)); },
            [weakSelf, name](NotificationCenter::Token token) {
                if (auto self = weakSelf.lock()) {
                    self->featureChanged(name, token);
                }
            });
        if (token) {
            std::lock_guard lock(featuresMutex_);
            Dictionary d = *features_.find(name)->asDictionary();
            d.set(QVReportingFeatureKeyNotifyToken, *token);
            features_.set(name, std::move(d));
        }
        // Status as the registration answered it: 0 registered, 1 failed (no token).
        QVLOG_DEFAULT(QVReportingSessionCategory(), "notify setup result {} token {}",
                      token ? 0 : 1, token.value_or(-1));
    }
}

void QVReportingSystemMonitor::featureChanged(const std::string& name,
                                              NotificationCenter::Token token) {
    QVLOG_INFO(QVReportingSessionCategory(), "feature changes featureName={} token={}", name,
               token);
    systemMonitorDictionary_->updateValueForKey(name, [&] { return getFeatureState(name); });
}

void QVReportingSystemMonitor::clear() {
    std::vector<NotificationCenter::Token> tokens;
    {
        std::lock_guard lock(featuresMutex_);
        Dictionary updated;
        for (const auto& [name, value] : features_) {
            Dictionary d = *value.asDictionary();
            if (const Value* token = d.find(QVReportingFeatureKeyNotifyToken)) {
                tokens.push_back(
                    static_cast<NotificationCenter::Token>(token->asInt64().value_or(0)));
                d.erase(QVReportingFeatureKeyNotifyToken);
            }
            updated.set(name, std::move(d));
        }
        features_ = std::move(updated);
    }
    for (const NotificationCenter::Token token : tokens) {
        platform_.notifications.cancel(token);
    }
}

}  // namespace qv
