#include "workers/backends/QVReportingSessionMTXWorker.h"

#include <cmath>
#include <limits>
#include <string>

#include "platform/MTXMetricsService.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "values/Utf8.h"
#include "workers/backends/mtx/AudioIssueDetected.h"

namespace qv {

namespace {

constexpr std::string_view kIssueTypeKey = "issue_type";
constexpr std::string_view kRtaidClientKey = "rtaid_client";
constexpr std::string_view kNodeKey = "node";
constexpr std::string_view kSilenceSecondsKey = "any_channel_silence_seconds";

// What the metrics service takes: the record, writing itself.
class RecordWriter final : public MTXMetricRecord {
  public:
    explicit RecordWriter(const mtxmetrics::AudioIssueDetected& record) : record_(record) {}
    void appendWireBytes(std::string& out) const override {
        mtxmetrics::Writer writer;
        record_.writeTo(writer);
        out += writer.data();
    }

  private:
    const mtxmetrics::AudioIssueDetected& record_;
};

// The value under key, or null when it is absent or null.
const Value* presentValue(const Dictionary& payload, std::string_view key) {
    const Value* value = payload.find(key);
    return value != nullptr && !value->isNull() ? value : nullptr;
}

// The "%@" text as a NUL-terminated byte string holds it: up to the first NUL; empty when the
// text has no UTF-8 form.
std::string byteString(const Value& value) {
    std::string text = QVReportingValueText(&value);
    if (!QVReportingIsValidUtf8(text)) {
        return {};
    }
    if (const auto nul = text.find('\0'); nul != std::string::npos) {
        text.resize(nul);
    }
    return text;
}

}  // namespace

std::int32_t QVReportingSessionMTXWorker::durationFromValue(const Value& value) {
    // An unsigned value is cut as it is, not first clamped to the signed range.
    const std::optional<std::uint64_t> unsignedValue = value.asUInt64();
    const std::uint64_t integer =
        unsignedValue ? *unsignedValue : static_cast<std::uint64_t>(value.longLongValue());
    return static_cast<std::int32_t>(static_cast<std::uint32_t>(integer));
}

std::shared_ptr<QVReportingSessionMTXWorker> QVReportingSessionMTXWorker::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    if (!session) {
        return nullptr;
    }
    auto worker = std::make_shared<QVReportingSessionMTXWorker>(session->platform().mtx);
    worker->setSession(session);
    return worker;
}

void QVReportingSessionMTXWorker::handleMessage(
    const std::shared_ptr<QVReportingSessionMessage>& message) {
    if (!message || message->type() != type::kIssueDetector) {
        return;
    }
    const Dictionary& payload = message->message();
    mtxmetrics::AudioIssueDetected record;
    const auto missing = [](std::string_view key) {
        QVLOG_ERROR(QVReportingMTXLogCategory(), "Failed to get {} for AudioIssueDetected", key);
    };
    if (const Value* v = presentValue(payload, kIssueTypeKey)) {
        record.issuetype = byteString(*v);
    } else {
        missing(kIssueTypeKey);
    }
    if (const Value* v = presentValue(payload, kRtaidClientKey)) {
        record.rtaidclient = byteString(*v);
    } else {
        missing(kRtaidClientKey);
    }
    if (const Value* v = presentValue(payload, kNodeKey)) {
        record.node = byteString(*v);
    } else {
        missing(kNodeKey);
    }
    if (const Value* v = presentValue(payload, kSilenceSecondsKey)) {
        record.duration = durationFromValue(*v);
    } else {
        missing(kSilenceSecondsKey);
    }
    // The timestamp is never set here, so the record goes out without field 1.
    mtx_.postMetric(kAudioIssueDetectedMetricID, RecordWriter(record));
}

}  // namespace qv
