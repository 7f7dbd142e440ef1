// The recording-side sibling of the volume worker: at stop, one "input" message (category Input,
// type Summary) per uninterrupted stretch of input running, with its running time, the
// voice-processing configuration, the active devices and the voice codecs used, each sent back
// into the session. Does nothing while the session runs.
//
// Unlike playback, a stretch of input is closed only by input stopping, by "session_duration" or
// by a change of active devices; a codec or format change does not close it. The codecs of a
// stretch accumulate until a message is made, and a codec whose rate text begins with "0." is
// never listed.
//
// Thread safety: runs on the session's queue; the derivation merges bursts of stored messages in
// place, which is safe only there.
#pragma once

#include <memory>
#include <optional>
#include <string_view>
#include <vector>

#include "session/QVReportingSessionWorker.h"
#include "workers/derived/QVReportingSessionVolumeMessagesWorker.h"

namespace qv {

class QVReportingSessionInputMessagesWorker final
    : public QVReportingSessionWorkerProducerProtocol {
  public:
    using MessageList = std::vector<std::shared_ptr<QVReportingSessionMessage>>;

    static constexpr std::string_view kClassName = "QVReportingSessionInputMessagesWorker";

    static std::shared_ptr<QVReportingSessionInputMessagesWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    // Derives the input messages from the session's stored messages and sends them into it.
    void stop() override;

    // createInputMessages:process:minimumRunningtime: — the input messages of the given
    // messages, in order, numbered by "msgidx" (from 1) and carrying the total as "msgcnt". The
    // running state starts from the session's previousValues, but a stretch is only counted from
    // a message that starts input. No message is made when process is absent. Bursts of
    // spatial-audio messages are merged into their first message in place.
    MessageList createInputMessages(const MessageList& messages,
                                    std::optional<std::string_view> process,
                                    double minimumRunningtime) const;
};

}  // namespace qv
