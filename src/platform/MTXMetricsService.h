// The wireless-diagnostics metrics service (MTX): binary metric records submitted under a 32-bit
// metric identifier.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <cstdint>
#include <string>

namespace qv {

// A metric record as the service takes it: something that writes itself in the Protocol Buffers
// wire format.
class MTXMetricRecord {
  public:
    virtual ~MTXMetricRecord() = default;
    // Appends the record's wire bytes to out.
    virtual void appendWireBytes(std::string& out) const = 0;
};

class MTXMetricsService {
  public:
    virtual ~MTXMetricsService() = default;

    // Submits record under metricID. Synchronous: the record is serialised before the call
    // returns, so the caller may destroy it right after. Nothing is reported back.
    virtual void postMetric(std::uint32_t metricID, const MTXMetricRecord& record) = 0;
};

}  // namespace qv
