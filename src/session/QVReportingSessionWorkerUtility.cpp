#include "session/QVReportingSessionWorkerUtility.h"

#include <string_view>
#include <unordered_set>

namespace qv {

namespace {

constexpr std::string_view kTimestampKey = "qvreporting_timestamp";
constexpr std::string_view kVidcallErrorPrefix = "vcac_invalid_";

double timestampOf(const QVReportingSessionMessage& message) {
    const Value* t = message.message().find(kTimestampKey);
    return t ? t->doubleValue() : 0.0;
}

}  // namespace

std::vector<std::shared_ptr<QVReportingSessionMessage>>
QVReportingSessionWorkerUtility::combineRapidMessages(
    const std::vector<std::shared_ptr<QVReportingSessionMessage>>& messages,
    const std::vector<std::string>& keysToCombine, double maximumPausetime) {
    std::vector<std::shared_ptr<QVReportingSessionMessage>> result;
    result.reserve(messages.size());
    std::unordered_set<std::string_view> seenKeys;
    std::shared_ptr<QVReportingSessionMessage> kept;

    for (const auto& message : messages) {
        const std::string* key = nullptr;
        if (message) {
            for (const std::string& candidate : keysToCombine) {
                if (message->message().contains(candidate)) {
                    key = &candidate;
                    break;
                }
            }
        }
        if (key == nullptr) {
            result.push_back(message);
            continue;
        }
        if (seenKeys.contains(*key)) {
            // A key repeating means the client has begun the next burst.
            seenKeys.clear();
            kept.reset();
        }
        seenKeys.insert(*key);
        if (!kept) {
            kept = message;
            result.push_back(message);
            continue;
        }
        if (timestampOf(*message) - timestampOf(*kept) < maximumPausetime) {
            // The merge brings the newer timestamp along, so the pause is measured from the
            // latest message of the burst.
            kept->message().merge(message->message());
        } else {
            // Too late to join, but not the start of a new burst either: later messages are
            // still compared with the kept one until a key repeats.
            result.push_back(message);
        }
    }
    return result;
}

bool QVReportingSessionWorkerUtility::isVidcallXYerrorMessage(
    const QVReportingSessionMessage& message) {
    for (const auto& entry : message.message()) {
        if (entry.first.starts_with(kVidcallErrorPrefix)) {
            return true;
        }
    }
    return false;
}

}  // namespace qv
