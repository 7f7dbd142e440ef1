// The error a client call answers with: a D-Bus error name and a human-readable message.
#pragma once

#include <string>

#include "QVReportingDBusNames.h"

namespace qv {

struct QVReportingError {
    std::string name;
    std::string message;

    // Error domain "com.korvane.audio.reporting", code 1: reporting is disabled.
    static QVReportingError reportingDisabled() {
        return {dbus::kErrorReportingDisabled,
                "com.korvane.audio.reporting error code 1: reporting is disabled"};
    }
    static QVReportingError limitsExceeded(std::string what) {
        return {dbus::kErrorLimitsExceeded, std::move(what)};
    }
    static QVReportingError invalidArgs(std::string what) {
        return {dbus::kErrorInvalidArgs, std::move(what)};
    }
};

}  // namespace qv
