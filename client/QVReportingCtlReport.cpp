// qvreportctl report: the state directory's sinks as an HTML page with plots, or as a table of
// sessions.
#include <algorithm>
#include <array>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <stdexcept>

#include <fmt/format.h>
#include <unistd.h>

#include "QVReportingCtl.h"
#include "QVReportingCtlReportData.h"
#include "QVReportingCtlReportPage.h"
#include "QVReportingCtlSupport.h"

namespace qv::ctl {

namespace {

using client::ReportData;

std::optional<double> parseTime(const std::string& text, const char* option) {
    if (text.empty()) {
        return std::nullopt;
    }
    const auto t = client::QVReportingCtlParseReportTime(text);
    if (!t) {
        throw UsageError{fmt::format(
            "{} {}: not a time (seconds since 1970 as the sinks write them, or an ISO 8601 date "
            "such as 2026-11-26, 2026-11-26T09:30 or 2026-11-26T09:30:00Z)",
            option, text)};
    }
    return t;
}

std::string busText(const std::string& bus) {
    return bus == "system" || bus == "session" ? "the " + bus + " bus" : "the bus " + bus;
}

// GetStats of the daemon on the chosen bus, when one is there; it is not started for this.
client::ReportCounters counters(const Options& options) {
    client::ReportCounters c;
    try {
        auto connection = QVReportingClient::connect(options.bus);
        if (connection->daemonOwner().empty()) {
            c.source = "no daemon runs on " + busText(options.bus);
            return c;
        }
        c.stats = client::QVReportingVariantMapToJson(connection->getStats());
        c.source = "GetStats of the daemon on " + busText(options.bus);
    } catch (const QVReportingClientError& e) {
        c.source = fmt::format("no daemon answers on {} ({})", busText(options.bus), e.message());
    }
    return c;
}

int printSummary(const Options& options, const ReportData& data) {
    if (options.json) {
        for (const auto& s : data.sessions) {
            emit(Json{{"reporterID", s.reporterID},
                      {"application", s.application},
                      {"service", s.service},
                      {"start", s.start},
                      {"end", s.end},
                      {"stopped", s.stopped},
                      {"messages", s.messages},
                      {"derived", s.derived},
                      {"issues", s.issues},
                      {"captures", s.captures}});
        }
        return 0;
    }
    if (data.sessions.empty()) {
        std::cerr << "qvreportctl: no sessions in this range" << std::endl;
        return 0;
    }
    using Row = std::array<std::string, 8>;
    std::vector<Row> rows{{"ID", "APPLICATION", "SERVICE", "STARTED (UTC)", "SECONDS", "MESSAGES",
                           "DERIVED", "ISSUES"}};
    for (const auto& s : data.sessions) {
        rows.push_back({std::to_string(s.reporterID), s.application.empty() ? "-" : s.application,
                        s.service, client::QVReportingCtlShortUTC(s.start),
                        s.stopped ? fmt::format("{:.1f}", s.end - s.start) : "running",
                        std::to_string(s.messages), client::QVReportingCtlCountsText(s.derived),
                        client::QVReportingCtlSessionIssuesText(s)});
    }
    std::array<std::size_t, 8> widths{};
    for (const auto& row : rows) {
        for (std::size_t i = 0; i < row.size(); ++i) {
            widths[i] = std::max(widths[i], row[i].size());
        }
    }
    for (const auto& row : rows) {
        std::string line;
        for (std::size_t i = 0; i < row.size(); ++i) {
            // Numbers to the right, text to the left; the last column is not padded.
            const bool number = i == 0 || i == 4 || i == 5;
            line += i + 1 == row.size() ? row[i]
                    : number            ? fmt::format("{:>{}}  ", row[i], widths[i])
                                        : fmt::format("{:<{}}  ", row[i], widths[i]);
        }
        std::cout << line << '\n';
    }
    std::cout.flush();
    return 0;
}

// Written beside its place and renamed, so a browser never shows half a page.
void writeAtomically(const std::filesystem::path& path, const std::string& text) {
    const std::filesystem::path temporary =
        path.parent_path() / fmt::format(".{}.{}.tmp", path.filename().string(), ::getpid());
    {
        std::ofstream out(temporary, std::ios::binary | std::ios::trunc);
        out << text;
        out.flush();
        if (!out) {
            std::error_code ec;
            std::filesystem::remove(temporary, ec);
            throw Failure{"cannot write " + path.string()};
        }
    }
    std::error_code ec;
    std::filesystem::rename(temporary, path, ec);
    if (ec) {
        std::filesystem::remove(temporary, ec);
        throw Failure{fmt::format("cannot write {}: {}", path.string(), ec.message())};
    }
}

}  // namespace

int report(const Options& options, const ReportOptions& report) {
    client::ReportFilter filter;
    filter.since = parseTime(report.since, "--since");
    filter.until = parseTime(report.until, "--until");
    filter.application = report.application;
    if (filter.since && filter.until && *filter.since >= *filter.until) {
        throw UsageError{"--since must come before --until"};
    }
    ReportData data;
    try {
        data = client::QVReportingCtlGatherReport(options.stateDir, filter);
    } catch (const std::runtime_error& e) {
        throw Failure{e.what()};
    }
    if (report.summary) {
        return printSummary(options, data);
    }
    std::string page;
    try {
        page = client::QVReportingCtlRenderReportPage(data, options.stateDir, counters(options),
                                                      now());
    } catch (const client::QVReportingCtlGnuplotError& e) {
        throw Failure{e.what()};
    }
    const std::filesystem::path path =
        std::filesystem::absolute(report.output.empty() ? "report.html" : report.output);
    writeAtomically(path, page);
    if (options.json) {
        emit({{"report", path.string()},
              {"sessions", data.sessions.size()},
              {"playbacks", data.playbacks.size()},
              {"issues", data.issues.size()},
              {"empty", data.empty()}});
    } else {
        std::cout << path.string() << std::endl;
        if (data.empty()) {
            std::cerr << "qvreportctl: no data in this range; the page says so" << std::endl;
        }
    }
    return 0;
}

}  // namespace qv::ctl
