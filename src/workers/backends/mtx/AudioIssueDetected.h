// mtxmetrics::AudioIssueDetected: the issue metric the MTX worker submits, one record per
// issue-detector message. Its schema ships as data/audio_issue_detected.proto (proto2), so protoc
// reads what writeTo writes.
//
// Fields and wire form: timestamp (1, varint, only when set), duration (2, int32 varint, always),
// issuetype (3), node (4), rtaidclient (5) (length-delimited byte strings, always, even empty),
// written in field-number order.
//
// readFrom takes fields until the data end, an end-group tag ends them, or the reader's error flag
// is set; it is true exactly when the flag stayed clear. For the five known fields the field
// number alone decides how the value is read; the wire type in the tag is not checked (so field 1
// written as a string reads its length byte as the timestamp and goes on from there). Other field
// numbers (0 included) are skipped by their wire type (see MTXWireFormat.h); a skip that fails
// ends the read with false. A field that comes again overwrites the earlier value; an over-long
// varint value reads as 0. What was read before a failure stays in the record.
//
// Equality and hash ignore a timestamp whose presence bit is clear, and every bit of `has` but
// bit 0. Copying copies everything; moving and swap exchange everything.
//
// Thread safety: a plain value.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>

#include "workers/backends/mtx/MTXWireFormat.h"

namespace mtxmetrics {

class AudioIssueDetected final : public Message {
  public:
    static constexpr std::uint32_t kHasTimestamp = 1u << 0;

    static constexpr std::uint32_t kTimestampFieldNumber = 1;
    static constexpr std::uint32_t kDurationFieldNumber = 2;
    static constexpr std::uint32_t kIssuetypeFieldNumber = 3;
    static constexpr std::uint32_t kNodeFieldNumber = 4;
    static constexpr std::uint32_t kRtaidclientFieldNumber = 5;

    AudioIssueDetected() = default;
    ~AudioIssueDetected() override = default;
    AudioIssueDetected(const AudioIssueDetected& other) = default;
    AudioIssueDetected& operator=(const AudioIssueDetected& other) = default;
    AudioIssueDetected(AudioIssueDetected&& other) noexcept;
    AudioIssueDetected& operator=(AudioIssueDetected&& other) noexcept;

    bool readFrom(Reader& reader) override;
    void writeTo(Writer& writer) const override;
    void formatText(TextFormatter& formatter, const char* name) const override;

    bool operator==(const AudioIssueDetected& other) const;
    bool operator!=(const AudioIssueDetected& other) const { return !(*this == other); }
    std::size_t hash_value() const;

    bool hasTimestamp() const { return (has & kHasTimestamp) != 0; }
    void setTimestamp(std::uint64_t value) {
        timestamp = value;
        has |= kHasTimestamp;
    }
    void clearTimestamp() { has &= ~kHasTimestamp; }

    // The fields, in declaration order. Byte strings, not necessarily text.
    std::string issuetype;
    std::string node;
    std::string rtaidclient;
    std::uint64_t timestamp = 0;  // meaningful only when hasTimestamp()
    std::int32_t duration = 0;
    std::uint32_t has = 0;  // presence mask: kHasTimestamp; other bits unused
};

void swap(AudioIssueDetected& a, AudioIssueDetected& b) noexcept;

}  // namespace mtxmetrics

template <>
struct std::hash<mtxmetrics::AudioIssueDetected> {
    std::size_t operator()(const mtxmetrics::AudioIssueDetected& record) const {
        return record.hash_value();
    }
};
