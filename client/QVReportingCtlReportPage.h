// The HTML page of `qvreportctl report`: one self-contained file (styles and plots inline, nothing
// fetched) with the plots gnuplot draws from a ReportData, the sessions' table and the guardrail
// counters.
//
// Each plot is a <figure class="plot" data-points="N"> holding gnuplot's SVG inline, N being the
// number of data points drawn; a plot without data holds a sentence that says so instead (and
// data-points="0"), never an empty graph.
//
// Thread safety: pure apart from running gnuplot.
#pragma once

#include <string>

#include <nlohmann/json.hpp>

#include "QVReportingCtlGnuplot.h"
#include "QVReportingCtlReportData.h"

namespace qv::client {

// The guardrail counters shown, and where they come from.
struct ReportCounters {
    // GetStats' answer (an object), or null when no daemon answered.
    nlohmann::ordered_json stats;
    // Where they come from, said on the page: "GetStats of the daemon on the system bus" or why
    // the files on disk stand in ("no daemon answers on the system bus").
    std::string source;
};

// The page. stateDir and generated (the time the report is made) are shown in its heading; the
// plots are drawn by gnuplotProgram, found on PATH. Throws QVReportingCtlGnuplotError.
std::string QVReportingCtlRenderReportPage(const ReportData& data, const std::string& stateDir,
                                           const ReportCounters& counters, double generated,
                                           const std::string& gnuplotProgram = "gnuplot");

}  // namespace qv::client
