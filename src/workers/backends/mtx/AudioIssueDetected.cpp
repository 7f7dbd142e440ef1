#include "workers/backends/mtx/AudioIssueDetected.h"

#include <utility>

namespace mtxmetrics {

AudioIssueDetected::AudioIssueDetected(AudioIssueDetected&& other) noexcept : Message() {
    swap(*this, other);
}

AudioIssueDetected& AudioIssueDetected::operator=(AudioIssueDetected&& other) noexcept {
    swap(*this, other);
    return *this;
}

void swap(AudioIssueDetected& a, AudioIssueDetected& b) noexcept {
    using std::swap;
    swap(a.issuetype, b.issuetype);
    swap(a.node, b.node);
    swap(a.rtaidclient, b.rtaidclient);
    swap(a.timestamp, b.timestamp);
    swap(a.duration, b.duration);
    swap(a.has, b.has);
}

bool AudioIssueDetected::readFrom(Reader& reader) {
    if (reader.atEnd()) {
        return !reader.hasError();
    }
    while (!reader.atEnd() && !reader.hasError()) {
        const std::uint64_t tag = reader.readVarint();
        const auto wireType = static_cast<std::uint32_t>(tag & 7);
        if (reader.hasError() || wireType == kWireTypeEndGroup) {
            break;
        }
        const std::uint64_t fieldNumber = tag >> 3;
        switch (fieldNumber) {
            case kTimestampFieldNumber:
                has |= kHasTimestamp;
                timestamp = reader.readVarint();
                break;
            case kDurationFieldNumber:
                duration =
                    static_cast<std::int32_t>(static_cast<std::uint32_t>(reader.readVarint()));
                break;
            case kIssuetypeFieldNumber:
                issuetype = reader.readData();
                break;
            case kNodeFieldNumber:
                node = reader.readData();
                break;
            case kRtaidclientFieldNumber:
                rtaidclient = reader.readData();
                break;
            default:
                if (!reader.skipField(fieldNumber, wireType)) {
                    return false;
                }
        }
    }
    return !reader.hasError();
}

void AudioIssueDetected::writeTo(Writer& writer) const {
    if (hasTimestamp()) {
        writer.writeVarint(timestamp, kTimestampFieldNumber);
    }
    writer.writeInt32(duration, kDurationFieldNumber);
    writer.writeData(issuetype, kIssuetypeFieldNumber);
    writer.writeData(node, kNodeFieldNumber);
    writer.writeData(rtaidclient, kRtaidclientFieldNumber);
}

void AudioIssueDetected::formatText(TextFormatter& formatter, const char* name) const {
    formatter.beginObject(name);
    formatter.formatInt32("duration", duration);
    formatter.formatString("issuetype", issuetype);
    formatter.formatString("node", node);
    formatter.formatString("rtaidclient", rtaidclient);
    if (hasTimestamp()) {
        formatter.formatUInt64("timestamp", timestamp);
    }
    formatter.endObject();
}

bool AudioIssueDetected::operator==(const AudioIssueDetected& other) const {
    if (hasTimestamp() != other.hasTimestamp()) {
        return false;
    }
    if (hasTimestamp() && timestamp != other.timestamp) {
        return false;
    }
    return duration == other.duration && issuetype == other.issuetype && node == other.node &&
           rtaidclient == other.rtaidclient;
}

std::size_t AudioIssueDetected::hash_value() const {
    const std::hash<std::string> h;
    std::size_t value = hasTimestamp() ? static_cast<std::size_t>(timestamp) : 0;
    value ^= static_cast<std::size_t>(static_cast<std::int64_t>(duration));
    value ^= h(issuetype);
    value ^= h(node);
    value ^= h(rtaidclient);
    return value;
}

}  // namespace mtxmetrics
