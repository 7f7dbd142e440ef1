// A metrics service in memory: it keeps the wire bytes of every record posted, as the Linux
// service would write them.
#pragma once

#include <cstdint>
#include <mutex>
#include <string>
#include <vector>

#include "platform/MTXMetricsService.h"

namespace qv::test {

class FakeMTXMetricsService : public MTXMetricsService {
  public:
    struct Posted {
        std::string wire;
    };

    void postMetric(std::uint32_t, const MTXMetricRecord& record) override {
        std::string wire;
        record.appendWireBytes(wire);
        std::lock_guard lock(mutex_);
        posted_.push_back({std::move(wire)});
    }

    std::vector<Posted> posted() const {
        std::lock_guard lock(mutex_);
        return posted_;
    }
    void clear() {
        std::lock_guard lock(mutex_);
        posted_.clear();
    }

  private:
    mutable std::mutex mutex_;
    std::vector<Posted> posted_;
};

}  // namespace qv::test
