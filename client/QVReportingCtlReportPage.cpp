#include "QVReportingCtlReportPage.h"

#include <algorithm>
#include <cmath>
#include <ctime>
#include <map>
#include <vector>

#include <fmt/format.h>

#include "QVReportingCtlSupport.h"
#include "values/Markup.h"

namespace qv::client {

namespace {

using Json = nlohmann::ordered_json;

constexpr int kPlotWidth = 900;
constexpr int kPlotHeight = 360;
// Beyond these the plots and the table keep the busiest or the latest; the page says so.
constexpr std::size_t kMaxApplications = 8;
constexpr std::size_t kMaxPlaybacks = 10;
constexpr std::size_t kMaxTableSessions = 500;

constexpr const char* kColors[] = {"#1f77b4", "#d62728", "#2ca02c", "#ff7f0e", "#9467bd",
                                   "#8c564b", "#e377c2", "#17becf", "#7f7f7f"};
std::string color(std::size_t i) {
    return fmt::format("lc rgb '{}'", kColors[i % std::size(kColors)]);
}

// Counters whose nonzero value means something was refused, dropped or lost.
bool isLossCounter(const std::string& key) {
    for (const char* word :
         {"exceeded", "refused", "dropped", "lost", "expired", "removed", "not_stored", "paused"}) {
        if (key.find(word) != std::string::npos) {
            return true;
        }
    }
    return false;
}

std::string application(const std::string& name) {
    return name.empty() ? "(no application)" : name;
}

std::string timeText(double t) {
    return t > 0 ? QVReportingCtlFormatUTC(t) : "-";
}

struct Plot {
    std::string id;
    std::string title;
    std::string note;        // below the title: what the plot shows and from where
    std::size_t points = 0;  // drawn; 0: the figure says emptyText instead
    std::string emptyText;
    std::string commands;
};

// A time axis over [first, last] that shows the time of day with the precision the span needs.
std::string timeAxis(double first, double last) {
    const double span = last - first;
    const double pad = std::max(span * 0.05, 0.5);
    const char* format = span < 120 ? "%H:%M:%.1S" : span < 2 * 86400 ? "%H:%M:%S" : "%m-%d %H:%M";
    return fmt::format(
        "set xdata time\nset timefmt '%s'\nset format x '{}'\nset xrange [{:.6f}:{:.6f}]\n"
        "set xlabel 'time (UTC)'\nset xtics rotate by -20\n",
        format, first - pad, last + pad);
}

std::string datablock(const std::string& name, const std::string& rows) {
    return fmt::format("${} << EOD\n{}EOD\n", name, rows);
}

// A data column of text: double-quoted, without the quotes and control characters it may hold.
std::string dataText(const std::string& text) {
    std::string out = "\"";
    for (const char c : text) {
        out += c == '"' || static_cast<unsigned char>(c) < 0x20 ? '\'' : c;
    }
    return out + "\"";
}

Plot sessionsPlot(const ReportData& data) {
    Plot plot{"plot-sessions",
              "Sessions per application over time",
              "Each bar a session, from its start to its stop, on its application's row (from "
              "the conversation-quality mirror, sinks/convo.jsonl; \"test\" sessions are not "
              "mirrored).",
              0,
              "No sessions in this range.",
              ""};
    std::map<std::string, std::vector<const ReportSession*>> byApplication;
    for (const auto& s : data.sessions) {
        byApplication[application(s.application)].push_back(&s);
    }
    std::vector<std::pair<std::string, std::vector<const ReportSession*>>> rows(
        byApplication.begin(), byApplication.end());
    std::stable_sort(rows.begin(), rows.end(), [](const auto& a, const auto& b) {
        return a.second.size() > b.second.size();
    });
    if (rows.size() > kMaxApplications) {
        std::vector<const ReportSession*> rest;
        for (std::size_t i = kMaxApplications - 1; i < rows.size(); ++i) {
            rest.insert(rest.end(), rows[i].second.begin(), rows[i].second.end());
        }
        const std::size_t others = rows.size() - (kMaxApplications - 1);
        rows.resize(kMaxApplications - 1);
        rows.emplace_back(fmt::format("{} other applications", others), std::move(rest));
    }
    // A session too short to see at this scale is drawn a sliver wide.
    const double least = std::max(data.last - data.first, 1.0) / 400;
    std::string ytics, plots;
    for (std::size_t i = 0; i < rows.size(); ++i) {
        const auto& [name, sessions] = rows[i];
        std::string bars;
        for (const ReportSession* s : sessions) {
            const double half = std::max(s->end - s->start, least) / 2;
            bars += fmt::format("{:.6f} {} {:.6f} 0.3\n", s->start + half, i + 1, half);
        }
        plot.commands += datablock(fmt::format("s{}", i), bars);
        ytics += fmt::format(
            "{}{} {}", i == 0 ? "" : ", ",
            QVReportingCtlGnuplot::quote(fmt::format("{} ({})", name, sessions.size())), i + 1);
        plots +=
            fmt::format("{}$s{} using 1:2:3:4 with boxxyerror {} fs solid 0.7 noborder notitle",
                        plots.empty() ? "" : ", ", i, color(i));
        plot.points += sessions.size();
    }
    plot.commands += timeAxis(data.first, data.last);
    plot.commands += fmt::format("set ytics ({})\nset yrange [0.4:{}.6]\nset grid x\nplot {}\n",
                                 ytics, rows.size(), plots);
    return plot;
}

Plot usagePlot(const std::string& id, const std::string& by,
               const std::map<std::string, ReportUsage>& rows) {
    Plot plot{id,
              "Playback and record time by " + by,
              "Seconds of playback and of recording, from the Volume and Input summaries the "
              "daemon derives when a session stops (sinks/analytics.jsonl).",
              0,
              "No playback or recording in this range.",
              ""};
    std::string data;
    for (const auto& [name, usage] : rows) {
        data += fmt::format("{} {:.3f} {:.3f}\n", dataText(name), usage.playSeconds,
                            usage.recordSeconds);
        plot.points += (usage.playSeconds > 0) + (usage.recordSeconds > 0);
    }
    plot.commands = datablock("u", data) +
                    "set style data histograms\nset style histogram clustered gap 1\n"
                    "set style fill solid 0.85 border -1\nset boxwidth 0.9 relative\n"
                    "set ylabel 'seconds'\nset yrange [0:*]\nset xtics rotate by -20 nomirror\n"
                    "set grid ytics\nset key below\n"
                    "plot $u using 2:xtic(1) title 'playback' " +
                    color(0) + ", $u using 3 title 'record' " + color(1) + "\n";
    return plot;
}

Plot volumePlot(const ReportData& data) {
    Plot plot{"plot-volume",
              "Volume over each playback",
              "The volume of each stretch of a playback (cut at each change of volume, device or "
              "format), from the start of the playback; from the Volume summaries of "
              "sinks/analytics.jsonl.",
              0,
              "No playback in this range.",
              ""};
    const std::size_t from =
        data.playbacks.size() > kMaxPlaybacks ? data.playbacks.size() - kMaxPlaybacks : 0;
    if (from > 0) {
        plot.note +=
            fmt::format(" The latest {} of {} playbacks.", kMaxPlaybacks, data.playbacks.size());
    }
    double top = 1;
    std::string plots;
    for (std::size_t i = from; i < data.playbacks.size(); ++i) {
        const auto& p = data.playbacks[i];
        std::string rows;
        double at = 0;
        for (const auto& s : p.stretches) {
            rows += fmt::format("{:.3f} {:.6f}\n", at, s.volume);
            at += s.seconds;
            top = std::max(top, s.volume);
        }
        rows += fmt::format("{:.3f} {:.6f}\n", at, p.stretches.back().volume);
        plot.commands += datablock(fmt::format("v{}", i), rows);
        const std::string title = fmt::format("{}, stopped {}", application(p.application),
                                              QVReportingCtlFormatUTC(p.time).substr(11, 8));
        plots += fmt::format(
            "{}$v{} using 1:2 with steps lw 2 {} title {}, $v{} using 1:2 with "
            "points pt 7 ps 0.6 {} notitle",
            plots.empty() ? "" : ", ", i, color(i - from), QVReportingCtlGnuplot::quote(title), i,
            color(i - from));
        plot.points += p.stretches.size();
    }
    plot.commands += fmt::format(
        "set xlabel 'seconds into the playback'\nset ylabel 'volume'\nset yrange [0:{:.3f}]\n"
        "set xrange [0:*]\nset grid\nset key below\nplot {}\n",
        top * 1.05, plots);
    return plot;
}

Plot issuesPlot(const ReportData& data) {
    Plot plot{"plot-issues",
              "Issues",
              "MTX records (sinks/mtx.jsonl), overloads (messages with \"issue_type\" "
              "\"overload\"), issue captures (sinks/issuecapture.jsonl), stack samples "
              "(sinks/diagnostics.jsonl) and bug report drafts (sinks/issuefiler.jsonl).",
              0,
              "No issues in this range.",
              ""};
    std::string ytics, plots;
    for (int k = 0; k < kReportIssueKinds; ++k) {
        const auto kind = static_cast<ReportIssue::Kind>(k);
        ytics += fmt::format(
            "{}{} {}", k == 0 ? "" : ", ",
            QVReportingCtlGnuplot::quote(std::string(QVReportingCtlIssueKindName(kind))), k + 1);
        std::string rows;
        std::size_t n = 0;
        for (const auto& issue : data.issues) {
            if (issue.kind == kind) {
                rows += fmt::format("{:.6f} {}\n", issue.time, k + 1);
                ++n;
            }
        }
        if (n == 0) {
            continue;
        }
        plot.commands += datablock(fmt::format("i{}", k), rows);
        plots += fmt::format("{}$i{} using 1:2 with points pt 7 ps 1.4 {} title {}",
                             plots.empty() ? "" : ", ", k, color(k),
                             QVReportingCtlGnuplot::quote(
                                 fmt::format("{} ({})", QVReportingCtlIssueKindName(kind), n)));
        plot.points += n;
    }
    plot.commands += timeAxis(data.first, data.last);
    plot.commands +=
        fmt::format("set ytics ({})\nset yrange [0.5:{}.5]\nset grid\nset key below\nplot {}\n",
                    ytics, kReportIssueKinds, plots);
    return plot;
}

void replaceAll(std::string& text, const std::string& from, const std::string& to) {
    for (std::size_t at = text.find(from); at != std::string::npos;
         at = text.find(from, at + to.size())) {
        text.replace(at, from.size(), to);
    }
}

// gnuplot's SVG made fit to sit inline beside others: no XML prologue, and ids of its own, since
// every plot defines the same point symbols under the same ids.
std::string inlineSvg(std::string svg, const std::string& prefix) {
    svg.erase(0, svg.find("<svg"));
    for (const char quote : {'\'', '"'}) {
        replaceAll(svg, fmt::format("id={}", quote), fmt::format("id={}{}-", quote, prefix));
        replaceAll(svg, fmt::format("href={}#", quote), fmt::format("href={}#{}-", quote, prefix));
    }
    replaceAll(svg, "url(#", "url(#" + prefix + "-");
    return svg;
}

constexpr const char* kStyle = R"(
body { font-family: sans-serif; margin: 2em auto; max-width: 960px; color: #222; }
h1 { font-size: 1.5em; margin-bottom: 0.2em; }
h2 { font-size: 1.15em; margin: 1.6em 0 0.3em; border-bottom: 1px solid #ddd; }
p.note, p.meta { color: #555; font-size: 0.9em; margin: 0.2em 0 0.6em; }
p.nodata { font-size: 1.1em; padding: 1em; background: #fff4e5; border: 1px solid #f0c080; }
figure.plot { margin: 0; }
figure.plot svg { width: 100%; height: auto; display: block; }
figure.plot.empty p { color: #777; font-style: italic; padding: 2em; background: #f6f6f6; }
table { border-collapse: collapse; font-size: 0.85em; width: 100%; }
th, td { text-align: left; padding: 0.2em 0.6em; border-bottom: 1px solid #eee; }
td.n { text-align: right; font-variant-numeric: tabular-nums; }
td.n, td.t { white-space: nowrap; }
tr.warn td { background: #fde8e8; }
)";

// The sessions, the latest last.
std::string sessionsSection(const ReportData& data) {
    const auto h = QVReportingEscapeMarkup;
    std::string page = "<section>\n<h2>Sessions</h2>\n";
    const std::size_t from =
        data.sessions.size() > kMaxTableSessions ? data.sessions.size() - kMaxTableSessions : 0;
    page += fmt::format(
        "<p class=\"note\">{} sessions{}; <code>qvreportctl report --summary</code> "
        "prints them too.</p>\n",
        data.sessions.size(),
        from > 0 ? fmt::format(", the latest {} shown", kMaxTableSessions) : "");
    page +=
        "<table id=\"sessions\">\n<tr><th>reporter ID</th><th>application</th><th>service</th>"
        "<th>started</th><th>seconds</th><th>messages</th><th>derived</th><th>issues</th></tr>\n";
    for (std::size_t i = from; i < data.sessions.size(); ++i) {
        const auto& s = data.sessions[i];
        page += fmt::format(
            "<tr><td class=\"n\">{}</td><td>{}</td><td>{}</td><td class=\"t\">{}</td>"
            "<td class=\"n\">{}</td><td class=\"n\">{}</td><td>{}</td><td>{}</td></tr>\n",
            s.reporterID, h(application(s.application)), h(s.service),
            QVReportingCtlShortUTC(s.start),
            s.stopped ? fmt::format("{:.1f}", s.end - s.start) : "running", s.messages,
            h(QVReportingCtlCountsText(s.derived)), h(QVReportingCtlSessionIssuesText(s)));
    }
    page += "</table>\n</section>\n";
    return page;
}

// The guardrail counters, and what the sink files hold.
std::string countersSection(const ReportData& data, const ReportCounters& counters) {
    const auto h = QVReportingEscapeMarkup;
    std::string page = "<section>\n<h2>Guardrail counters</h2>\n";
    if (counters.stats.is_object()) {
        page += fmt::format(
            "<p class=\"note\" id=\"counters-source\">From {}, when this report "
            "was made. Rows in red: something was refused, dropped or lost.</p>\n"
            "<table id=\"counters\">\n<tr><th>counter</th><th>value</th></tr>\n",
            h(counters.source));
        for (const auto& [key, value] : counters.stats.items()) {
            const bool warn = isLossCounter(key) && value.is_number() && value.get<double>() > 0;
            page += fmt::format("<tr{}><td>{}</td><td class=\"n\">{}</td></tr>\n",
                                warn ? " class=\"warn\"" : "", h(key),
                                h(value.dump(-1, ' ', false, Json::error_handler_t::replace)));
        }
        page += "</table>\n";
    } else {
        page += fmt::format(
            "<p class=\"note\" id=\"counters-source\">From the files on disk: {}. Lines missing "
            "were removed by the sinks' disk budget before they were read; unreadable lines are "
            "not JSON objects with a time.</p>\n",
            h(counters.source));
    }
    page +=
        "<table id=\"sink-files\">\n<tr><th>sink</th><th>files</th><th>bytes</th><th>lines</th>"
        "<th>seq</th><th>lines missing</th><th>lines unreadable</th></tr>\n";
    for (const auto& [sink, files] : data.sinks) {
        page += fmt::format(
            "<tr{}><td>{}</td><td class=\"n\">{}</td><td class=\"n\">{}</td><td class=\"n\">{}</td>"
            "<td class=\"n\">{} to {}</td><td class=\"n\">{}</td><td class=\"n\">{}</td></tr>\n",
            files.linesMissing + files.linesUnreadable > 0 ? " class=\"warn\"" : "", h(sink),
            files.segments, files.bytes, files.lines, files.firstSeq, files.lastSeq,
            files.linesMissing, files.linesUnreadable);
    }
    page += "</table>\n</section>\n";
    return page;
}

}  // namespace

std::string QVReportingCtlRenderReportPage(const ReportData& data, const std::string& stateDir,
                                           const ReportCounters& counters, double generated,
                                           const std::string& gnuplotProgram) {
    const auto h = QVReportingEscapeMarkup;
    std::vector<Plot> plots;
    plots.push_back(sessionsPlot(data));
    std::map<std::string, ReportUsage> byApplication, byDevice;
    for (const auto& [app, devices] : data.usage) {
        for (const auto& [device, usage] : devices) {
            for (auto* row : {&byApplication[application(app)], &byDevice[device]}) {
                row->playSeconds += usage.playSeconds;
                row->recordSeconds += usage.recordSeconds;
            }
        }
    }
    plots.push_back(usagePlot("plot-usage-application", "application", byApplication));
    plots.push_back(usagePlot("plot-usage-device", "device", byDevice));
    plots.push_back(volumePlot(data));
    plots.push_back(issuesPlot(data));

    QVReportingCtlGnuplot gnuplot(gnuplotProgram);
    std::vector<std::size_t> drawn(plots.size());
    for (std::size_t i = 0; i < plots.size(); ++i) {
        if (plots[i].points > 0) {
            drawn[i] = gnuplot.add(plots[i].commands);
        }
    }
    const std::vector<std::string> svgs = gnuplot.run(kPlotWidth, kPlotHeight);

    const auto& f = data.filter;
    std::string page = fmt::format(
        "<!DOCTYPE html>\n<html lang=\"en\">\n<head>\n<meta charset=\"utf-8\">\n"
        "<title>qvreportd report: {}</title>\n<style>{}</style>\n</head>\n<body>\n"
        "<h1>Audio reporting</h1>\n<p class=\"meta\">State directory {}; made {}.<br>\n"
        "Range: {} to {}; application: {}. Times are UTC, as the sinks write them.</p>\n",
        h(stateDir), kStyle, h(stateDir), timeText(generated),
        f.since ? timeText(*f.since) : "the first line", f.until ? timeText(*f.until) : "the last",
        f.application.empty() ? "every one" : h(f.application));
    if (data.empty()) {
        page += fmt::format(
            "<p class=\"nodata\" id=\"no-data\">No data in this range: the sinks hold no "
            "sessions, playback, recording or issues {}{}.</p>\n",
            f.since || f.until ? "between the times given" : "at all",
            f.application.empty() ? "" : " for " + h(f.application));
    } else {
        page += fmt::format("<p class=\"meta\">Data from {} to {}.</p>\n", timeText(data.first),
                            timeText(data.last));
    }
    for (std::size_t i = 0; i < plots.size(); ++i) {
        const Plot& p = plots[i];
        page += fmt::format("<section>\n<h2>{}</h2>\n<p class=\"note\">{}</p>\n", h(p.title),
                            h(p.note));
        if (p.points > 0) {
            page +=
                fmt::format("<figure class=\"plot\" id=\"{}\" data-points=\"{}\">\n{}\n</figure>\n",
                            p.id, p.points, inlineSvg(svgs[drawn[i]], p.id));
        } else {
            page += fmt::format(
                "<figure class=\"plot empty\" id=\"{}\" data-points=\"0\"><p>{}</p></figure>\n",
                p.id, h(p.emptyText));
        }
        page += "</section>\n";
    }

    page += sessionsSection(data) + countersSection(data, counters);
    page += "</body>\n</html>\n";
    return page;
}

}  // namespace qv::client
