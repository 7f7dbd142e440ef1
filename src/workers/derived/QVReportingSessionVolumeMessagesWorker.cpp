#include "workers/derived/QVReportingSessionVolumeMessagesWorker.h"

#include <cmath>
#include <cstdint>
#include <string>

#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingSessionWorkerUtility.h"
#include "session/QVReportingUtility.h"
#include "workers/derived/QVReportingDerivedMessages.h"
#include "workers/derived/QVReportingMessageKeys.h"

namespace qv {

const std::vector<double> QVReportingUtilityBucketNumberToStringVolumes = {
    0.0,    0.0625, 0.125,  0.1875, 0.25,   0.3125, 0.375,  0.4375, 0.5,
    0.5625, 0.625,  0.6875, 0.75,   0.8125, 0.875,  0.9375, 1.0,
};
const std::vector<double> QVReportingUtilityBucketNumberToStringTimes = {
    0, 1, 5, 10, 30, 60, 300, 1800, 3600, 7200, 18000,
};

namespace {

constexpr std::string_view kFunction = "createVolumeMessages";
// Spatial-audio settings arrive as bursts of single-key messages; one burst is one change.
constexpr double kSpatialBurstPause = 5.0;
constexpr std::uint64_t kVolumeBucketPlaces = 4;
constexpr std::uint64_t kTimeBucketPlaces = 0;

// The value a stretch held for a key, from the running state.
Value stateValue(const Dictionary& state, std::string_view key) {
    const Value* value = state.find(key);
    return value ? *value : Value();
}

// Numbers compare by value, so a flag sent as true and later as 1 has not changed; text reads as
// the number it starts with ("0.5" is 0.5), anything else as 0. A repeated NaN is the same
// reading, not a change.
bool numbersDiffer(const Value& a, const Value& b) {
    const double x = a.doubleValue();
    const double y = b.doubleValue();
    if (std::isnan(x) && std::isnan(y)) {
        return false;
    }
    return x != y;
}

bool watchedKeysChanged(const Dictionary& payload, const Dictionary& state) {
    for (const std::string_view key :
         {QVReportingMessageKeySelectedFormat, QVReportingMessageKeyActiveDevices}) {
        const Value* now = payload.find(key);
        const Value* before = state.find(key);
        if (now && before && QVReportingValueText(now) != QVReportingValueText(before)) {
            return true;
        }
    }
    for (const std::string_view key :
         {QVReportingMessageKeySpatializationEnabled, QVReportingMessageKeyRingerState,
          QVReportingMessageKeyVolume}) {
        const Value* now = payload.find(key);
        const Value* before = state.find(key);
        if (now && before && numbersDiffer(*now, *before)) {
            return true;
        }
    }
    return false;
}

std::shared_ptr<QVReportingSessionMessage> makeVolumeMessage(const Dictionary& state,
                                                             std::string_view process,
                                                             double playingTime,
                                                             std::int64_t index) {
    const Value volume = stateValue(state, QVReportingMessageKeyVolume);
    Dictionary payload;
    payload.reserve(14);
    payload.set(QVReportingMessageKeySelectedFormat,
                stateValue(state, QVReportingMessageKeySelectedFormat));
    payload.set(QVReportingMessageKeyFormatID, stateValue(state, QVReportingMessageKeyFormatID));
    payload.set(QVReportingMessageKeyActiveDevices,
                stateValue(state, QVReportingMessageKeyActiveDevices));
    payload.set(QVReportingApplicationName, process);
    payload.set(QVReportingMessageKeyVolume, volume);
    // The tables are never empty, so a label always comes back.
    payload.set("KXSessionVolumeBucketed",
                QVReportingUtilityBucketNumberToString(
                    volume.doubleValue(), QVReportingUtilityBucketNumberToStringVolumes,
                    kVolumeBucketPlaces)
                    .value_or(""));
    // Reported in single precision, as consumers of this event expect.
    payload.set("play_seconds", static_cast<double>(static_cast<float>(playingTime)));
    payload.set(QVReportingMessageKeySpatialAudioAccessoryFeature,
                stateValue(state, QVReportingMessageKeySpatialAudioAccessoryFeature));
    payload.set(QVReportingMessageKeySpatializationEnabled,
                stateValue(state, QVReportingMessageKeySpatializationEnabled));
    payload.set(QVReportingMessageKeyRingerState,
                stateValue(state, QVReportingMessageKeyRingerState));
    payload.set(QVReportingMessageKeyChannelsPerFrame,
                stateValue(state, QVReportingMessageKeyChannelsPerFrame));
    payload.set("play_secondsBucketed",
                QVReportingUtilityBucketNumberToString(
                    playingTime, QVReportingUtilityBucketNumberToStringTimes, kTimeBucketPlaces)
                    .value_or(""));
    payload.set("msgidx", index);
    return std::make_shared<QVReportingSessionMessage>(std::move(payload), category::kVolume,
                                                       type::kSummary);
}

}  // namespace

std::shared_ptr<QVReportingSessionVolumeMessagesWorker>
QVReportingSessionVolumeMessagesWorker::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    auto worker = std::make_shared<QVReportingSessionVolumeMessagesWorker>();
    worker->setSession(session);
    return worker;
}

void QVReportingSessionVolumeMessagesWorker::stop() {
    const auto owner = session();
    if (!owner || owner->messages().empty()) {
        return;
    }
    QVReportingSendDerivedMessages(
        *owner, "volume event",
        createVolumeMessages(owner->messages(),
                             QVReportingUtilityRetrieveAppName(owner->configuration()),
                             QVReportingUtilityVolumeMinimumPlayingTime(owner->serviceType())));
}

QVReportingSessionVolumeMessagesWorker::MessageList
QVReportingSessionVolumeMessagesWorker::createVolumeMessages(
    const MessageList& messages, std::optional<std::string_view> process,
    double minimumPlaytime) const {
    const auto& log = QVReportingSessionCategory();
    QVLOG_DEBUG(log, "entering createVolumeMessages {}", kFunction);

    const MessageList combined = QVReportingSessionWorkerUtility::combineRapidMessages(
        messages,
        {std::string(QVReportingMessageKeySpatialAudioAccessoryFeature),
         std::string(QVReportingMessageKeySpatializationEnabled)},
        kSpatialBurstPause);

    Dictionary state = {
        {std::string(QVReportingMessageKeySelectedFormat), "unknown"},
        {std::string(QVReportingMessageKeyActiveDevices), "unknown"},
        {std::string(QVReportingMessageKeyFormatID), "unknown"},
        {std::string(QVReportingMessageKeySpatialAudioAccessoryFeature), false},
        {std::string(QVReportingMessageKeySpatializationEnabled), false},
        {std::string(QVReportingMessageKeyRingerState), false},
        {std::string(QVReportingMessageKeyChannelsPerFrame), -1},
    };
    if (const auto owner = session()) {
        state.merge(owner->previousValues());
    }

    MessageList results;
    std::int64_t index = 1;

    // Playback still running from before: the stretch goes on, but forgetting the running flag
    // keeps this stop from reporting it until a message says output runs again.
    std::optional<Value> start;
    bool running = false;
    if (const Value* inherited = state.find(QVReportingMessageKeySessionOutputRunning);
        inherited && inherited->boolValue()) {
        if (const Value* stamp = state.find(QVReportingMessageKeyQVTimestamp)) {
            start = *stamp;
        }
        running = true;
        state.erase(QVReportingMessageKeySessionOutputRunning);
    }

    for (const auto& message : combined) {
        if (!message) {
            continue;
        }
        const Dictionary& payload = message->message();
        const Value* ts = payload.find(QVReportingMessageKeyQVTimestamp);

        const Value* was = state.find(QVReportingMessageKeySessionOutputRunning);
        const bool wasRunning = was && was->boolValue();
        const bool hasDuration = payload.contains(QVReportingMessageKeySessionDuration);

        bool changed = false;
        if (const Value* now = payload.find(QVReportingMessageKeySessionOutputRunning)) {
            const bool nowRunning = now->boolValue();
            running = nowRunning;
            if (!wasRunning && nowRunning) {
                start = ts ? std::optional<Value>(*ts) : std::nullopt;
            }
            changed = (wasRunning && !nowRunning) || hasDuration;
        } else {
            running = running && !hasDuration;
            changed = hasDuration;
        }
        if (running && watchedKeysChanged(payload, state)) {
            changed = true;
        }

        if (wasRunning && changed) {
            const std::optional<double> end = QVReportingDerivedTimeValue(ts);
            const std::optional<double> begin =
                QVReportingDerivedTimeValue(start ? &*start : nullptr);
            const double playingTime = end.value_or(0.0) - begin.value_or(0.0);
            QVLOG_DEBUG(log,
                        "playingTime {{ func={}, playingTime={:f}, qvTimestamp={}, "
                        "qvTimestamp_double={:f}, startQvTimestamp={}, "
                        "startQvTimestamp_double={:f} }}",
                        kFunction, playingTime, QVReportingValueText(ts), end.value_or(0.0),
                        QVReportingValueText(start ? &*start : nullptr), begin.value_or(0.0));
            if (end && begin && playingTime > minimumPlaytime && process &&
                state.contains(QVReportingMessageKeyVolume)) {
                results.push_back(makeVolumeMessage(state, *process, playingTime, index));
                ++index;
                QVLOG_DEBUG(log, "added volume message {{ func={}, action=add, count={} }}",
                            kFunction, results.size());
            } else {
                QVLOG_DEBUG(log,
                            "skipped volume message, too short {{ func={}, action=skip, count={} "
                            "}}",
                            kFunction, results.size());
            }
            start = ts ? std::optional<Value>(*ts) : std::nullopt;
        }
        if (!running) {
            start.reset();
        }
        state.merge(payload);
    }

    for (const auto& result : results) {
        result->message().set("msgcnt", static_cast<std::uint64_t>(results.size()));
    }
    return results;
}

}  // namespace qv
