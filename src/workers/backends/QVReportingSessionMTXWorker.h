// Turns each issue-detector message (type 7, any category) of its session into one
// mtxmetrics::AudioIssueDetected record and submits it to the metrics service (MTX) under
// 0x5B0003. Keeps no state between messages and derives none.
//
// Payload keys, read in this order: "issue_type" -> issuetype, "rtaid_client" -> rtaidclient,
// "node" -> node, "any_channel_silence_seconds" -> duration. Each missing key (absent, or a null
// value) is logged on the MTX category and the record goes out with the fields that were found.
//
// - A string field takes the value's "%@" text (a string as it is; any other kind by its
//   description, so the number 12 gives "12", 2.5 "2.5", NaN "nan", a bool "1" or "0", a
//   container its multi-line description), as the NUL-terminated UTF-8 bytes of that text: the
//   bytes up to the first NUL. Text that is not valid UTF-8 is stored empty.
// - duration takes the value's integer value, truncated to its low 32 bits. The integer value of
//   an integer is itself; of a double, the double truncated toward zero (NaN gives 0; beyond the
//   signed 64-bit range, the nearest end of it); of a bool, 1 or 0; of a string, the decimal
//   integer it begins with after leading blanks, with an optional sign and nothing of a fraction
//   ("42s" gives 42, "-3.9" gives -3, "abc" and "" give 0; beyond the signed 64-bit range, the
//   nearest end of it); of anything else (dates, bytes, containers), 0.
//
// Thread safety: called on the session's queue, like every worker.
#pragma once

#include <cstdint>
#include <memory>
#include <string_view>

#include "session/QVReportingSessionWorker.h"
#include "values/Value.h"

namespace qv {

class MTXMetricsService;

class QVReportingSessionMTXWorker final : public QVReportingSessionWorkerConsumerProtocol {
  public:
    static constexpr std::string_view kClassName = "QVReportingSessionMTXWorker";
    // The metric identifier of AudioIssueDetected.
    static constexpr std::uint32_t kAudioIssueDetectedMetricID = 0x5B0003;

    static bool handleSingleMessageSession() { return true; }
    static bool startOnInit() { return true; }

    static std::shared_ptr<QVReportingSessionMTXWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& message) override;

    explicit QVReportingSessionMTXWorker(MTXMetricsService& mtx) : mtx_(mtx) {}

    // The integer value of a payload value truncated to 32 bits, as duration takes it.
    static std::int32_t durationFromValue(const Value& value);

  private:
    // The platform outlives every session: a record still goes out should the session be gone.
    MTXMetricsService& mtx_;
};

}  // namespace qv
