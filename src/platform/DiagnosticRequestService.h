// The diagnostic-request service: a component that saw trouble asks for a diagnostic report of a
// given kind to be taken system-wide now (a stack sample of every process, say), so that the cause
// can be examined later. The service records every request; whether and how it samples depends
// on the request's options and on what the system allows.
//
// Thread safety: request may be called from any thread and never waits for the report to be
// taken.
#pragma once

#include <string_view>

#include "values/Value.h"

namespace qv {

// How a request wants its report taken.
struct DiagnosticRequestOptions {
    // Take a stack sample of the whole system; without it the request is only recorded.
    bool sampleStacks = false;
    // Sample whole call chains rather than the interrupted function alone.
    bool callGraphs = false;
    // Sample over the service's longer window rather than its usual one.
    bool extendedWindow = false;
    // Sample user-space code only, leaving the kernel out.
    bool userSpaceOnly = false;
    // Keep the raw sample only, without the readable report made from it.
    bool skipReport = false;

    bool operator==(const DiagnosticRequestOptions&) const = default;
};

class DiagnosticRequestService {
  public:
    virtual ~DiagnosticRequestService() = default;

    // Asks for a report of kind (e.g. "AudioOverloads") under domain (the asker's reverse-DNS
    // name), with a description and the payload that explains the request.
    virtual void request(std::string_view domain, std::string_view kind,
                         std::string_view description, const Dictionary& payload,
                         const DiagnosticRequestOptions& options) = 0;
};

}  // namespace qv
