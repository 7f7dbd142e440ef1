// The energy logging service (EnergyLog): named events with a payload dictionary, logged under the
// numeric identifier of an event registry.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <cstdint>
#include <string_view>

#include "values/Value.h"

namespace qv {

class EnergyLogService {
  public:
    virtual ~EnergyLogService() = default;

    // Logs eventName with payload in the registry registryID. options is the service's optional
    // fourth argument (callers here pass null). Synchronous: what the service keeps is copied
    // before the call returns. Nothing is reported back.
    virtual void logRegisteredEvent(std::uint32_t registryID, std::string_view eventName,
                                    const Dictionary& payload, const Dictionary* options) = 0;
};

}  // namespace qv
