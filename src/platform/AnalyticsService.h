// The analytics event service: named events with a payload that is built only if and when the
// service records the event.
//
// Thread safety: every member may be called from any thread. The payload producer may be run
// later, on another thread; it must own what it reads.
#pragma once

#include <functional>
#include <string_view>

#include "values/Value.h"

namespace qv {

class AnalyticsService {
  public:
    using PayloadProducer = std::function<Dictionary()>;

    virtual ~AnalyticsService() = default;

    // Whether any consumer is configured for the event; false means skip it without building
    // its payload.
    virtual bool isEventUsed(std::string_view eventName) const = 0;
    // Records the event; calls producer at most once, possibly after this call returns.
    virtual void sendEventLazy(std::string_view eventName, PayloadProducer producer) = 0;
};

}  // namespace qv
