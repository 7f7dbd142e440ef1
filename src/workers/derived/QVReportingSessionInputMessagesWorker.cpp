#include "workers/derived/QVReportingSessionInputMessagesWorker.h"

#include <cstdint>
#include <set>
#include <string>

#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingSessionWorkerUtility.h"
#include "session/QVReportingUtility.h"
#include "workers/derived/QVReportingDerivedMessages.h"
#include "workers/derived/QVReportingMessageKeys.h"

namespace qv {

namespace {

constexpr std::string_view kFunction = "createInputMessages";
// Shorter than for playback: recording settings that belong together arrive closer together.
constexpr double kSpatialBurstPause = 2.0;
constexpr std::uint64_t kTimeBucketPlaces = 0;
// A rate text starting like this is a codec that is configured but not running.
constexpr std::string_view kIdleRatePrefix = "0.";

Value stateValue(const Dictionary& state, std::string_view key) {
    const Value* value = state.find(key);
    return value ? *value : Value();
}

std::shared_ptr<QVReportingSessionMessage> makeInputMessage(const Dictionary& state,
                                                            std::string_view process,
                                                            double runningTime, std::int64_t index,
                                                            const std::set<std::string>& codecs) {
    Dictionary payload;
    payload.reserve(9);
    payload.set(QVReportingApplicationName, process);
    // Reported in single precision, as consumers of this event expect.
    payload.set("inputrunning_seconds", static_cast<double>(static_cast<float>(runningTime)));
    // The table is never empty, so a label always comes back.
    payload.set("inputrunning_secondsBucketed",
                QVReportingUtilityBucketNumberToString(
                    runningTime, QVReportingUtilityBucketNumberToStringTimes, kTimeBucketPlaces)
                    .value_or(""));
    payload.set("msgidx", index);
    payload.set(QVReportingMessageKeyVpConfigOperationMode,
                stateValue(state, QVReportingMessageKeyVpConfigOperationMode));
    payload.set(QVReportingMessageKeyVpConfigInputPort,
                stateValue(state, QVReportingMessageKeyVpConfigInputPort));
    payload.set(QVReportingMessageKeyActiveDevices,
                stateValue(state, QVReportingMessageKeyActiveDevices));
    if (!codecs.empty()) {
        std::string joined;
        for (const std::string& codec : codecs) {
            if (!joined.empty()) {
                joined += ',';
            }
            joined += codec;
        }
        payload.set("vocoders", std::move(joined));
    }
    return std::make_shared<QVReportingSessionMessage>(std::move(payload), category::kInput,
                                                       type::kSummary);
}

}  // namespace

std::shared_ptr<QVReportingSessionInputMessagesWorker>
QVReportingSessionInputMessagesWorker::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    auto worker = std::make_shared<QVReportingSessionInputMessagesWorker>();
    worker->setSession(session);
    return worker;
}

void QVReportingSessionInputMessagesWorker::stop() {
    const auto owner = session();
    if (!owner || owner->messages().empty()) {
        return;
    }
    QVReportingSendDerivedMessages(
        *owner, "input summary event",
        createInputMessages(owner->messages(),
                            QVReportingUtilityRetrieveAppName(owner->configuration()),
                            QVReportingUtilityVolumeMinimumPlayingTime(owner->serviceType())));
}

QVReportingSessionInputMessagesWorker::MessageList
QVReportingSessionInputMessagesWorker::createInputMessages(const MessageList& messages,
                                                           std::optional<std::string_view> process,
                                                           double minimumRunningtime) const {
    const auto& log = QVReportingSessionCategory();
    QVLOG_DEBUG(log, "entering createInputMessages {}", kFunction);

    const MessageList combined = QVReportingSessionWorkerUtility::combineRapidMessages(
        messages,
        {std::string(QVReportingMessageKeySpatialAudioAccessoryFeature),
         std::string(QVReportingMessageKeySpatializationEnabled)},
        kSpatialBurstPause);

    Dictionary state = {
        {std::string(QVReportingMessageKeySelectedFormat), "unknown"},
        {std::string(QVReportingMessageKeyActiveDevices), "unknown"},
        {std::string(QVReportingMessageKeyFormatID), "unknown"},
        {std::string(QVReportingMessageKeyVpConfigOperationMode), "unknown"},
        {std::string(QVReportingMessageKeyVpConfigInputPort), "unknown"},
        {std::string(QVReportingMessageKeyVpConfigPrimaryVocoderFs), "unknown"},
        {std::string(QVReportingMessageKeyVpConfigPrimaryVocoder), "unknown"},
    };
    if (const auto owner = session()) {
        state.merge(owner->previousValues());
    }

    MessageList results;
    std::set<std::string> codecs;
    std::int64_t index = 1;
    // Input still running from before this walk has no known start: that stretch is not counted.
    std::optional<Value> start;
    bool running = false;

    for (const auto& message : combined) {
        if (!message) {
            continue;
        }
        const Dictionary& payload = message->message();
        const Value* ts = payload.find(QVReportingMessageKeyQVTimestamp);

        const Value* was = state.find(QVReportingMessageKeySessionInputRunning);
        const bool wasRunning = was && was->boolValue();
        const bool hasDuration = payload.contains(QVReportingMessageKeySessionDuration);

        const Value* now = payload.find(QVReportingMessageKeySessionInputRunning);
        const bool nowRunning = now && now->boolValue();
        if (now && !wasRunning && nowRunning) {
            start = ts ? std::optional<Value>(*ts) : std::nullopt;
        }
        bool changed = false;
        if (now && !nowRunning) {
            running = false;
            changed = wasRunning || hasDuration;
        } else if (!now && (!running || hasDuration)) {
            running = false;
            changed = hasDuration;
        } else {
            changed = QVReportingUtilityKeyIsPresentAndHasChanged(
                          QVReportingMessageKeyActiveDevices, &payload, &state) ||
                      hasDuration;
            if (QVReportingUtilityKeyIsPresentAndHasChanged(
                    QVReportingMessageKeyVpConfigPrimaryVocoder, &payload, &state)) {
                const std::string rate = QVReportingValueText(
                    payload.find(QVReportingMessageKeyVpConfigPrimaryVocoderFs));
                if (!rate.starts_with(kIdleRatePrefix)) {
                    codecs.insert(QVReportingValueText(
                                      payload.find(QVReportingMessageKeyVpConfigPrimaryVocoder)) +
                                  ":" + rate);
                }
            }
            running = true;
        }

        if (wasRunning && changed) {
            const std::optional<double> end = QVReportingDerivedTimeValue(ts);
            const std::optional<double> begin =
                QVReportingDerivedTimeValue(start ? &*start : nullptr);
            const double runningTime = end.value_or(0.0) - begin.value_or(0.0);
            QVLOG_DEBUG(log,
                        "runningTime {{ func={}, runningTime={:f}, qvTimestamp={}, "
                        "qvTimestamp_double={:f}, startQvTimestamp={}, "
                        "startQvTimestamp_double={:f} }}",
                        kFunction, runningTime, QVReportingValueText(ts), end.value_or(0.0),
                        QVReportingValueText(start ? &*start : nullptr), begin.value_or(0.0));
            if (end && begin && process && runningTime > minimumRunningtime) {
                results.push_back(makeInputMessage(state, *process, runningTime, index, codecs));
                ++index;
                QVLOG_DEBUG(log, "added input message {{ func={}, action=add, count={} }}",
                            kFunction, results.size());
                codecs.clear();
                start = ts ? std::optional<Value>(*ts) : std::nullopt;
            } else {
                QVLOG_DEBUG(log,
                            "skipped input message, too short {{ func={}, action=skip, count={} "
                            "}}",
                            kFunction, results.size());
            }
        }
        if (!running) {
            start.reset();
        }
        state.merge(payload);
    }

    for (const auto& result : results) {
        result->message().set("msgcnt", static_cast<std::uint64_t>(results.size()));
    }
    QVLOG_DEBUG(log, "returning input messages {{ func={}, action=return, count={} }}", kFunction,
                results.size());
    return results;
}

}  // namespace qv
