// The name a device goes by in the stream: the machine ID made specific to this application
// (sd_id128_get_machine_app_specific), so that the stream never carries the raw machine ID and
// IDs of two applications on one machine cannot be correlated.
#pragma once

#include <string>

namespace qv::exporter {

// 32 lower-case hexadecimal digits, or an empty string (error says why) when the machine has no
// ID.
std::string QVReportingExportDeviceID(std::string& error);

}  // namespace qv::exporter
