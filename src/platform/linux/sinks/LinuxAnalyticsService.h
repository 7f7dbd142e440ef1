// The analytics event service on Linux: every recorded event becomes one line of the
// "analytics" sink, {"time", "event", "payload"}.
//
// Which events are in use: all of them, unless the service was made with an events file, which
// lists the names in use one a line, each an exact name or a shell glob ("com.korvane.*.Volume.*",
// matched with fnmatch); blank lines and lines starting with '#' are ignored, and surrounding
// white space is not part of a name. A file that lists nothing leaves every event unused.
//
// sendEventLazy() calls the producer at once, on the caller's thread, and only for an event in
// use: the payload is copied while the caller still owns what it reads, and never built for an
// event nobody wants. Writing happens later on the sink's thread and never makes the caller wait.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_set>
#include <vector>

#include "platform/AnalyticsService.h"
#include "platform/linux/sinks/JsonlSink.h"

namespace qv {

class Clock;

class LinuxAnalyticsService final : public AnalyticsService {
  public:
    static constexpr std::string_view kSinkName = "analytics";

    struct Created {
        std::unique_ptr<LinuxAnalyticsService> service;  // null when error is set
        std::string error;
    };

    // The service writing to <stateDir>/sinks/analytics.jsonl; eventsFile empty means every
    // event is in use. An events file that cannot be read gives no service and says why.
    static Created create(const std::string& stateDir, const Clock& clock,
                          const std::string& eventsFile, SinkCallbacks callbacks,
                          SinkSegmentPolicy segments = {});

    // eventPatterns: names and globs in use, or nothing for every event.
    LinuxAnalyticsService(std::unique_ptr<JsonlSink> sink,
                          std::optional<std::vector<std::string>> eventPatterns);

    bool isEventUsed(std::string_view eventName) const override;
    void sendEventLazy(std::string_view eventName, PayloadProducer producer) override;

    // Blocks until every event recorded so far is in the file.
    void flush() { sink_->flush(); }
    const JsonlSink& sink() const { return *sink_; }

  private:
    const std::unique_ptr<JsonlSink> sink_;
    const bool everyEventUsed_;
    // Names without glob characters are looked up; only the rest go through fnmatch.
    std::unordered_set<std::string> exactNames_;
    std::vector<std::string> globs_;
};

}  // namespace qv
