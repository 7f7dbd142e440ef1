// The process-wide system monitor: follows a few facts about the device that matter when reading
// audio reports ("features": the spatial-audio accessory feature, the device name set for this
// service, the ringer switch). It reads each once at start, registers for the named notification
// that announces its change, and keeps the latest state of each in one shared, observable
// dictionary, from which every session's system monitor worker reports.
//
// A feature state is a dictionary holding the feature's value under the feature's name, plus
// "qvreporting_timestamp" and "systemuptime_sec" of the moment it was read.
//
// Lifecycle: initializeWithQueue() at service start makes the one monitor; reset() (tests only)
// cancels its registrations and drops it.
//
// Thread safety: every member may be called from any thread. Notification handlers run on the
// queue given to initializeWithQueue(), so observers of the shared dictionary are called there.
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "monitoring/QVReportingObservedDictionary.h"
#include "platform/NotificationCenter.h"
#include "platform/Platform.h"
#include "values/Value.h"

namespace qv {

class PreferenceStore;
class SerialQueue;

inline constexpr std::string_view QVReportingMessageKeySpatialAudioAccessoryFeature =
    "spatial-audio-accessory-feature";
inline constexpr std::string_view QVReportingMessageKeySpatialAudioAccessoryFeatureDomain =
    "com.korvane.deskhost";
inline constexpr std::string_view QVReportingMessageKeyDeviceName = "device_name";
inline constexpr std::string_view QVReportingMessageKeyRingerState = "ringerstate";
inline constexpr std::string_view QVReportingMessageKeyDisableReporting = "disable_reporting";

// The service's own user-defaults suite, and the notification that announces changes to it.
inline constexpr std::string_view QVReportingDefaultsSuite = "com.korvane.qvsound";
inline constexpr std::string_view QVReportingDefaultsChangedNotification =
    "com.korvane.qvsound.reporting";
inline constexpr std::string_view QVReportingSpatialAudioAccessoryFeatureChangedNotification =
    "com.korvane.deskhost.spatial-audio-accessory-feature.changed";
inline constexpr std::string_view QVReportingRingerStateNotification =
    "com.korvane.deskhost.ringerstate";

// Keys of a feature descriptor.
inline constexpr std::string_view QVReportingFeatureKeyDefaultsDomain = "defaults_domain";
inline constexpr std::string_view QVReportingFeatureKeyFeatureDomain = "feature_domain";
inline constexpr std::string_view QVReportingFeatureKeyNotification = "notification";
inline constexpr std::string_view QVReportingFeatureKeyNotifyToken = "notify_token";

// The service's own settings from the suite "com.korvane.qvsound": "device_name" when the suite
// holds it as a string, and "disable_reporting" as a boolean (false when the suite has none).
Dictionary QVReportingDefaults(const PreferenceStore& preferences);

class QVReportingSystemMonitor : public std::enable_shared_from_this<QVReportingSystemMonitor> {
  public:
    // Makes the one monitor with initWithQueue() unless there is one already; later calls do
    // nothing. The queue and the platform's services must outlive the monitor.
    static void initializeWithQueue(SerialQueue& queue, const Platform& platform);
    // The one monitor, or null before initializeWithQueue() and after reset().
    static std::shared_ptr<QVReportingSystemMonitor> shared();
    // The shared dictionary of feature states; null when there is no monitor.
    static std::shared_ptr<QVReportingObservedDictionary> getSystemMonitorDictionary();
    // The feature names in their declared order; empty when there is no monitor.
    static std::vector<std::string> getSystemMonitorKeys();
    // For tests: cancels the monitor's registrations and drops it.
    static void reset();

    // A monitor that has read every feature and listens for their changes; handlers run on
    // queue. Normally made through initializeWithQueue().
    static std::shared_ptr<QVReportingSystemMonitor> initWithQueue(SerialQueue& queue,
                                                                   const Platform& platform);
    ~QVReportingSystemMonitor();

    QVReportingSystemMonitor(const QVReportingSystemMonitor&) = delete;
    QVReportingSystemMonitor& operator=(const QVReportingSystemMonitor&) = delete;

    // What QVReportingDefaults() gave when the monitor was made.
    const Dictionary& getDefaults() const { return defaults_; }
    // Feature name -> feature descriptor, in declared order.
    Dictionary features() const;
    std::vector<std::string> featureNames() const;
    const std::shared_ptr<QVReportingObservedDictionary>& systemMonitorDictionary() const {
        return systemMonitorDictionary_;
    }

    // The feature's current state, or nothing for an unknown feature or an unreadable value.
    std::optional<Dictionary> getFeatureState(std::string_view name) const;
    // Stores the state of every feature that has one.
    void populateInitialValues();
    // Registers for every feature's notification, keeping the token in its descriptor.
    void listenForFeatureStateChanges();
    // Cancels every registration.
    void clear();

  private:
    QVReportingSystemMonitor(SerialQueue& queue, const Platform& platform);

    void featureChanged(const std::string& name, NotificationCenter::Token token);

    const Platform platform_;
    SerialQueue& queue_;
    const Dictionary defaults_;
    const std::vector<std::string> featureNames_;
    // Descriptors gain their "notify_token" while handlers may already read them.
    mutable std::mutex featuresMutex_;
    Dictionary features_;  // guarded by featuresMutex_
    const std::shared_ptr<QVReportingObservedDictionary> systemMonitorDictionary_;
};

}  // namespace qv
