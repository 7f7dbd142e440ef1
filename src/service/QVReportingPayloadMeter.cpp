#include "service/QVReportingPayloadMeter.h"

#include <fmt/format.h>

namespace qv {

bool QVReportingPayloadMeter::charge(std::size_t bytes) {
    bytes_ += bytes;
    if (bytes_ > budget_.maxBytes) {
        return refuse(QVReportingStats::Limit::PayloadBytes,
                      fmt::format("a payload may hold at most {} bytes", budget_.maxBytes));
    }
    return true;
}

// Values are counted as the payload will hold them, so that what is accepted keeps to the limit
// once decoded.
bool QVReportingPayloadMeter::countValue() {
    if (++values_ > budget_.maxValues) {
        return refuse(QVReportingStats::Limit::PayloadValues,
                      fmt::format("a payload may hold at most {} values", budget_.maxValues));
    }
    return true;
}

bool QVReportingPayloadMeter::refuseDepth() {
    return refuse(QVReportingStats::Limit::PayloadDepth,
                  fmt::format("a payload may nest at most {} deep", budget_.maxDepth));
}

bool QVReportingPayloadMeter::refuse(QVReportingStats::Limit which, std::string why) {
    limit = which;
    // The key tells the client which part of its payload to look at.
    if (!key.empty()) {
        why += fmt::format(" (passed at the value under \"{}\")", key);
    }
    error = QVReportingError::limitsExceeded(std::move(why));
    return false;
}

}  // namespace qv
