// The daemon's worker classes in their fixed order. A class joins this list at its place once it
// is built; the service hands the list to the worker registry when the process starts.
#pragma once

#include "session/QVReportingWorkerRegistry.h"

namespace qv {

QVReportingWorkerRegistry::ClassList QVReportingAllWorkerClasses();

}  // namespace qv
