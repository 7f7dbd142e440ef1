#include "platform/linux/sinks/LinuxEnergyLogService.h"

namespace qv {

void LinuxEnergyLogService::logRegisteredEvent(std::uint32_t registryID, std::string_view eventName,
                                               const Dictionary& payload,
                                               const Dictionary* options) {
    Dictionary members;
    members.reserve(4);
    members.set("registry", registryID);
    members.set("event", eventName);
    members.set("payload", payload);
    if (options != nullptr) {
        members.set("options", *options);
    }
    sink_->append(std::move(members));
}

}  // namespace qv
