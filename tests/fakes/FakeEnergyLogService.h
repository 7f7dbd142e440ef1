// An energy logging service in memory: it keeps every event logged, in order.
#pragma once

#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/EnergyLogService.h"

namespace qv::test {

class FakeEnergyLogService : public EnergyLogService {
  public:
    struct Event {
        std::uint32_t registryID;
        std::string name;
        Dictionary payload;
        std::optional<Dictionary> options;
    };

    void logRegisteredEvent(std::uint32_t registryID, std::string_view eventName,
                            const Dictionary& payload, const Dictionary* options) override {
        std::lock_guard lock(mutex_);
        events_.push_back({registryID, std::string(eventName), payload,
                           options ? std::optional<Dictionary>(*options) : std::nullopt});
    }

    std::vector<Event> events() const {
        std::lock_guard lock(mutex_);
        return events_;
    }
    void clear() {
        std::lock_guard lock(mutex_);
        events_.clear();
    }

  private:
    mutable std::mutex mutex_;
    std::vector<Event> events_;
};

}  // namespace qv::test
