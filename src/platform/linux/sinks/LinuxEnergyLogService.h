// The energy logging service on Linux: every event logged becomes one line of the "energylog" sink
// (<stateDir>/sinks/energylog.jsonl), {"time", "registry": ID, "event": NAME, "payload": {...}},
// with "options" after the payload when the caller gave any.
//
// The payload is copied on the caller's thread; the writing happens on the sink's thread, so a
// call never waits for the disk.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <memory>
#include <string_view>

#include "platform/EnergyLogService.h"
#include "platform/linux/sinks/JsonlSink.h"

namespace qv {

class LinuxEnergyLogService final : public EnergyLogService {
  public:
    static constexpr std::string_view kSinkName = "energylog";

    explicit LinuxEnergyLogService(std::unique_ptr<JsonlSink> sink) : sink_(std::move(sink)) {}

    void logRegisteredEvent(std::uint32_t registryID, std::string_view eventName,
                            const Dictionary& payload, const Dictionary* options) override;

    // Blocks until every event logged so far is in the file.
    void flush() { sink_->flush(); }
    const JsonlSink& sink() const { return *sink_; }

  private:
    const std::unique_ptr<JsonlSink> sink_;
};

}  // namespace qv
