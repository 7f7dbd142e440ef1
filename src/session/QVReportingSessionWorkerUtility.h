// Helpers that several workers share for reading a session's messages. Class operations only.
//
// Thread safety: combineRapidMessages writes to the messages it is given, so it runs only on the
// queue that owns them (the session's); isVidcallXYerrorMessage only reads.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "session/QVReportingSessionMessage.h"

namespace qv {

class QVReportingSessionWorkerUtility {
  public:
    QVReportingSessionWorkerUtility() = delete;

    // Folds bursts of single-setting messages into one message. Walking the messages in order, a
    // message's first key found in keysToCombine (in keysToCombine's order) decides: a key seen
    // before in the current burst starts a new burst; the first message of a burst is kept; a
    // later one that arrives less than maximumPausetime seconds after the kept one (by
    // "qvreporting_timestamp", 0 when absent) is merged into the kept message's payload, in
    // place, and dropped; a later one that arrives too late is passed on unchanged without
    // ending the burst. Messages holding none of the keys, and null entries, are passed on.
    //
    // REQUIRES: called on the queue that owns the messages; the kept messages are modified.
    static std::vector<std::shared_ptr<QVReportingSessionMessage>> combineRapidMessages(
        const std::vector<std::shared_ptr<QVReportingSessionMessage>>& messages,
        const std::vector<std::string>& keysToCombine, double maximumPausetime);

    // Whether a key of the message's payload begins with "vcac_invalid_".
    static bool isVidcallXYerrorMessage(const QVReportingSessionMessage& message);
};

}  // namespace qv
