// The metrics service on Linux: every record posted becomes one line of the "mtx" sink
// (<stateDir>/sinks/mtx.jsonl), {"time", "metric": ID, "record": base64 of the wire bytes}.
// data/audio_issue_detected.proto is the schema protoc reads such a record with.
//
// postMetric() serialises the record on the caller's thread (the caller destroys it right after)
// and leaves the writing to the sink's thread, so it never waits for the disk.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <memory>
#include <string_view>

#include "platform/MTXMetricsService.h"
#include "platform/linux/sinks/JsonlSink.h"

namespace qv {

class LinuxMTXMetricsService final : public MTXMetricsService {
  public:
    static constexpr std::string_view kSinkName = "mtx";

    explicit LinuxMTXMetricsService(std::unique_ptr<JsonlSink> sink) : sink_(std::move(sink)) {}

    void postMetric(std::uint32_t metricID, const MTXMetricRecord& record) override;

    // Blocks until every record posted so far is in the file.
    void flush() { sink_->flush(); }
    const JsonlSink& sink() const { return *sink_; }

  private:
    const std::unique_ptr<JsonlSink> sink_;
};

}  // namespace qv
