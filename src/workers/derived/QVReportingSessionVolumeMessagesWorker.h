// Turns the playback-state messages of a session into "volume" summaries: at stop, one message
// (category Volume, type Summary) per uninterrupted stretch of output playback, with how long it
// played and at which volume, format, devices, spatial-audio and ringer state, each sent back
// into the session for the backend workers. Does nothing while the session runs.
//
// A stretch opens when "session_output_running" turns true and closes when it turns false, when a
// message holds "session_duration", or when a watched setting (selected format, active devices,
// spatialization, ringer state, volume) changes while playing; a change closes one stretch and
// opens the next at the same instant. Stretches no longer than the minimum playing time, and the
// one still playing when the messages run out, are not reported.
//
// Thread safety: runs on the session's queue; the derivation merges bursts of stored messages in
// place, which is safe only there.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "session/QVReportingSessionWorker.h"
#include "values/Value.h"

namespace qv {

// Bucket boundaries of the derived messages. Volumes: 0 to 1 in steps of 1/16. Times, in
// seconds: 0, 1, 5, 10, 30, 60, 300, 1800, 3600, 7200, 18000 (also used for input running time).
extern const std::vector<double> QVReportingUtilityBucketNumberToStringVolumes;
extern const std::vector<double> QVReportingUtilityBucketNumberToStringTimes;

class QVReportingSessionVolumeMessagesWorker final
    : public QVReportingSessionWorkerProducerProtocol {
  public:
    using MessageList = std::vector<std::shared_ptr<QVReportingSessionMessage>>;

    static constexpr std::string_view kClassName = "QVReportingSessionVolumeMessagesWorker";

    static std::shared_ptr<QVReportingSessionVolumeMessagesWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    // Derives the volume messages from the session's stored messages and sends them into it.
    void stop() override;

    // createVolumeMessages:process:minimumPlaytime: — the volume messages of the given messages,
    // in order, each numbered by "msgidx" (from 1) and carrying the total as "msgcnt". The
    // running state starts from the session's previousValues. No message is made when process
    // is absent. Bursts of spatial-audio messages are merged into their first message in place.
    MessageList createVolumeMessages(const MessageList& messages,
                                     std::optional<std::string_view> process,
                                     double minimumPlaytime) const;
};

}  // namespace qv
