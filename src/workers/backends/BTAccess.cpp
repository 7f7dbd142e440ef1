#include "workers/backends/BTAccess.h"

#include "session/QVReportingLog.h"

namespace qv {

BTAccess::BTAccess(const Platform& platform) : baseUnit_(platform, registrationInfo_) {
    QVLOG_DEBUG(QVReportingAudioRegistrationCategory(), "BTAccess initialize");
}

const Dictionary& BTAccess::gatherData() {
    registrationInfo_.clear();
    baseUnit_.enumerateBluetoothDevices();
    const std::uint16_t count = baseUnit_.getDeviceCount();
    for (std::size_t i = 0; i < count; ++i) {
        baseUnit_.loadParams(BaseUnit::kLeft, i);
        baseUnit_.loadParams(BaseUnit::kRight, i);
        if (isDeviceWithCase()) {
            baseUnit_.loadParams(BaseUnit::kCase, i);
        }
    }
    return registrationInfo_;
}

}  // namespace qv
