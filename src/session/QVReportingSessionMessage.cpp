#include "session/QVReportingSessionMessage.h"

#include <algorithm>
#include <cmath>
#include <numeric>

#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"

namespace qv {

namespace {

// Room for the keys a session stamps on every message, so stamping does not reallocate.
constexpr std::size_t kStampedKeys = 4;

}  // namespace

QVReportingSessionMessage::QVReportingSessionMessage(const Dictionary& payload,
                                                     AudioEventCategory category,
                                                     AudioEventType type)
    : message_(payload, kStampedKeys), category_(category), type_(type) {}

QVReportingSessionMessage::QVReportingSessionMessage(Dictionary&& payload,
                                                     AudioEventCategory category,
                                                     AudioEventType type)
    : message_(std::move(payload)), category_(category), type_(type) {
    message_.reserveMore(kStampedKeys);
}

std::string QVReportingSessionMessage::description() const {
    return fmt::format("category={} type={} {}", QVReportingUtilityCategoryString(category_),
                       QVReportingUtilityTypeString(type_), message_.description());
}

std::shared_ptr<QVReportingSessionMessage> QVReportingSessionMessage::copy() const {
    QVLOG_DEBUG(QVReportingSessionCategory(), "copyWithZone");
    // Nested containers are immutable and shared, so copying the top level copies every value.
    auto copy = std::make_shared<QVReportingSessionMessage>(message_, category_, type_);
    copy->isRedundant_ = isRedundant_;
    copy->isSessionStarted_ = isSessionStarted_;
    return copy;
}

void QVReportingSessionMessage::sortMessages(
    std::vector<std::shared_ptr<QVReportingSessionMessage>>& messages) {
    // Read every time once rather than in each comparison.
    std::vector<std::pair<double, std::size_t>> keyed(messages.size());
    for (std::size_t i = 0; i < messages.size(); ++i) {
        double t = QVReportingSession::getEpochTimeFromQVReportingStateMessage(*messages[i]);
        // NaN would break the ordering the sort relies on; it counts as no time at all.
        keyed[i] = {std::isnan(t) ? 0.0 : t, i};
    }
    std::stable_sort(keyed.begin(), keyed.end(),
                     [](const auto& a, const auto& b) { return a.first < b.first; });
    std::vector<std::shared_ptr<QVReportingSessionMessage>> sorted;
    sorted.reserve(messages.size());
    for (const auto& k : keyed) {
        sorted.push_back(std::move(messages[k.second]));
    }
    messages = std::move(sorted);
}

}  // namespace qv
