#include "platform/linux/sinks/LinuxMTXMetricsService.h"

#include <string>

namespace qv {

void LinuxMTXMetricsService::postMetric(std::uint32_t metricID, const MTXMetricRecord& record) {
    std::string wire;
    record.appendWireBytes(wire);
    Dictionary members;
    members.reserve(2);
    members.set("metric", metricID);
    // Bytes go into the line as base64.
    members.set("record", Bytes(wire.begin(), wire.end()));
    sink_->append(std::move(members));
}

}  // namespace qv
