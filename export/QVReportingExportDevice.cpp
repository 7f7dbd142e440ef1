#include "QVReportingExportDevice.h"

#include <cstring>

#include <systemd/sd-id128.h>

namespace qv::exporter {

namespace {

// The exporter's own application ID; changing it renames every device in the stream.
constexpr sd_id128_t kApplicationID =
    SD_ID128_MAKE(7b, 78, f2, 5c, 0c, d9, 4b, a0, b2, a0, e1, a1, d1, d7, 5d, 74);

}  // namespace

std::string QVReportingExportDeviceID(std::string& error) {
    sd_id128_t id;
    if (const int r = sd_id128_get_machine_app_specific(kApplicationID, &id); r < 0) {
        error = std::string("no machine ID: ") + std::strerror(-r);
        return {};
    }
    char text[SD_ID128_STRING_MAX];
    return sd_id128_to_string(id, text);
}

}  // namespace qv::exporter
