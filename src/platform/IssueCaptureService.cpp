#include "platform/IssueCaptureService.h"

namespace qv {

std::optional<std::string_view> IssueCaptureErrorName(std::int64_t code) {
    switch (code) {
        case kIssueCaptureErrorNone:
            return "kIssueCaptureErrorNone";
        case kIssueCaptureErrorServiceNotReady:
            return "kIssueCaptureErrorServiceNotReady";
        case kIssueCaptureErrorNotSupported:
            return "kIssueCaptureErrorNotSupported";
        case kIssueCaptureErrorServiceUnavailable:
            return "kIssueCaptureErrorServiceUnavailable";
        case kIssueCaptureErrorServiceInterrupted:
            return "kIssueCaptureErrorServiceInterrupted";
        case kIssueCaptureErrorInvalidParameters:
            return "kIssueCaptureErrorInvalidParameters";
        case kIssueCaptureErrorDailyLimitExceeded:
            return "kIssueCaptureErrorDailyLimitExceeded";
        case kIssueCaptureErrorRandomizedSuppression:
            return "kIssueCaptureErrorRandomizedSuppression";
        case kIssueCaptureErrorSessionNotFound:
            return "kIssueCaptureErrorSessionNotFound";
        case kIssueCaptureErrorRequestThrottled:
            return "kIssueCaptureErrorRequestThrottled";
        default:
            return std::nullopt;
    }
}

}  // namespace qv
