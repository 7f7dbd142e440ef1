// The issue-capture service (ICX): a detector that recognises an audio issue asks it for
// diagnostics, identified by an issue signature: either a one-off snapshot, or a timed session
// that collects when its duration has passed unless it is cancelled first. Requests go through a
// client object, the IssueCaptureReporter, which is also the factory of signatures.
//
// Replies: a request that the service accepts is answered later with one reply dictionary
// (kIssueCaptureReplySuccess, kIssueCaptureReplySessionID, kIssueCaptureReplyReason). The reply
// callback may run on any thread, the caller's included, and may run after the caller stopped
// caring: it must only store what it is given.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "values/Value.h"

namespace qv {

// Keys of a reply dictionary.
inline constexpr std::string_view kIssueCaptureReplySuccess = "success";      // bool
inline constexpr std::string_view kIssueCaptureReplySessionID = "sessionID";  // string
inline constexpr std::string_view kIssueCaptureReplyReason = "reason";        // integer code
// Payload key: parameters for the service's diagnostic extensions, by extension identifier.
inline constexpr std::string_view kIssueCaptureKeyPayloadDEParameters = "DEParameters";

// Keys of a signature dictionary.
inline constexpr std::string_view kIssueCaptureSignatureDomain = "domain";
inline constexpr std::string_view kIssueCaptureSignatureType = "type";
inline constexpr std::string_view kIssueCaptureSignatureSubtype = "subtype";
inline constexpr std::string_view kIssueCaptureSignatureSubtypeContext = "subtypeContext";
inline constexpr std::string_view kIssueCaptureSignatureDetectedProcess = "detectedProcess";
inline constexpr std::string_view kIssueCaptureSignatureThresholdValues = "thresholdValues";

// Error codes under kIssueCaptureReplyReason.
inline constexpr std::int64_t kIssueCaptureErrorNone = 0;
inline constexpr std::int64_t kIssueCaptureErrorServiceNotReady = 1;
inline constexpr std::int64_t kIssueCaptureErrorNotSupported = 2;
inline constexpr std::int64_t kIssueCaptureErrorServiceUnavailable = 3;
inline constexpr std::int64_t kIssueCaptureErrorServiceInterrupted = 4;
inline constexpr std::int64_t kIssueCaptureErrorInvalidParameters = 5;
inline constexpr std::int64_t kIssueCaptureErrorDailyLimitExceeded = 6;
inline constexpr std::int64_t kIssueCaptureErrorRandomizedSuppression = 7;
inline constexpr std::int64_t kIssueCaptureErrorSessionNotFound = 8;
inline constexpr std::int64_t kIssueCaptureErrorRequestThrottled = 9;

// The constant's name of an error code ("kIssueCaptureErrorDailyLimitExceeded"), or nothing for
// a code the service does not define.
std::optional<std::string_view> IssueCaptureErrorName(std::int64_t code);

// One client of the service.
class IssueCaptureReporter {
  public:
    using ReplyCallback = std::function<void(const Dictionary& reply)>;

    virtual ~IssueCaptureReporter() = default;

    // A signature of the six parts; thresholdValues is left out when absent.
    virtual Dictionary makeSignature(std::string_view domain, std::string_view type,
                                     std::string_view subtype, std::string_view subtypeContext,
                                     std::string_view detectedProcess,
                                     const std::optional<Dictionary>& thresholdValues) = 0;

    // Asks for a snapshot now. True when the parameters were accepted; then reply runs once,
    // later. False (and reply never runs) when they were not.
    virtual bool snapshotWithSignature(const Dictionary& signature, double duration,
                                       const std::optional<Dictionary>& event,
                                       const std::optional<Dictionary>& payload,
                                       ReplyCallback reply) = 0;

    // Starts a timed session that collects after duration seconds unless cancelled. Same result
    // and reply rule as a snapshot; the reply names the session on success.
    virtual bool startSessionWithSignature(const Dictionary& signature, double duration,
                                           const std::optional<Array>& events,
                                           const std::optional<Dictionary>& payload,
                                           const std::optional<Array>& actions,
                                           ReplyCallback reply) = 0;

    // Cancels the timed session of that identifier; unknown identifiers are the service's
    // business (it records them), not the caller's.
    virtual void cancelSession(const std::string& sessionIdentifier) = 0;
};

class IssueCaptureService {
  public:
    virtual ~IssueCaptureService() = default;

    // A new client object. Never null.
    virtual std::shared_ptr<IssueCaptureReporter> createReporter() = 0;
};

}  // namespace qv
