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

// The decimal integer a string begins with, after blanks and an optional sign; saturated at the
// ends of the signed 64-bit range; 0 when there is none.
std::int64_t leadingInteger(std::string_view text) {
    std::size_t i = 0;
    while (i < text.size() && (text[i] == ' ' || text[i] == '\t' || text[i] == '\n' ||
                               text[i] == '\r' || text[i] == '\v' || text[i] == '\f')) {
        ++i;
    }
    bool negative = false;
    if (i < text.size() && (text[i] == '+' || text[i] == '-')) {
        negative = text[i] == '-';
        ++i;
    }
    // Accumulated as a magnitude, stopped before it passes 2^63 (|INT64_MIN|).
    constexpr std::uint64_t kCap = std::uint64_t{1} << 63;  // |INT64_MIN|
    std::uint64_t magnitude = 0;
    for (; i < text.size() && text[i] >= '0' && text[i] <= '9'; ++i) {
        const auto digit = static_cast<std::uint64_t>(text[i] - '0');
        if (magnitude > (kCap - digit) / 10) {
            magnitude = kCap + 1;  // saturated either way; the other digits do not matter
            break;
        }
        magnitude = magnitude * 10 + digit;
    }
    if (negative) {
        return magnitude >= kCap ? std::numeric_limits<std::int64_t>::min()
                                 : -static_cast<std::int64_t>(magnitude);
    }
    return magnitude >= kCap ? std::numeric_limits<std::int64_t>::max()
                             : static_cast<std::int64_t>(magnitude);
}

}  // namespace

std::int32_t QVReportingSessionMTXWorker::durationFromValue(const Value& value) {
    std::uint64_t integer = 0;
    switch (value.kind()) {
        case Value::Kind::UInt:
            integer = *value.asUInt64();
            break;
        case Value::Kind::Bool:
        case Value::Kind::Int:
        case Value::Kind::Double:
            // Doubles truncate toward zero; NaN reads 0 and the ends saturate.
            integer = static_cast<std::uint64_t>(*value.asInt64());
            break;
        case Value::Kind::String:
            integer = static_cast<std::uint64_t>(leadingInteger(*value.asString()));
            break;
        default:
            break;
    }
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
