#include "QVReportingCtlReportData.h"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <cmath>
#include <ctime>
#include <filesystem>
#include <functional>
#include <list>
#include <stdexcept>

#include <nlohmann/json.hpp>

#include "QVReportingCtlMTXRecord.h"
#include "QVReportingCtlSupport.h"
#include "platform/SinkSegments.h"
#include "session/QVReportingVocabulary.h"

namespace qv::client {

namespace {

using Json = nlohmann::ordered_json;

// Analytics carries every message twice (under the daemon's name and the service's); the first
// name alone counts each once.
constexpr std::string_view kAnalyticsPrefix = "com.korvane.qvsound.";
// The convo mirror's folded summary at stop: the mirror's own, not a message of the session.
constexpr std::int64_t kConvoSummary = 65535;
constexpr std::string_view kSessionSuffix = "_session";

std::string text(const Json& object, const char* key) {
    if (!object.is_object()) {
        return {};
    }
    const auto it = object.find(key);
    if (it == object.end() || it->is_null()) {
        return {};
    }
    return it->is_string() ? it->get<std::string>()
                           : it->dump(-1, ' ', false, Json::error_handler_t::replace);
}

double number(const Json& object, const char* key, double otherwise = 0) {
    if (!object.is_object()) {
        return otherwise;
    }
    const auto it = object.find(key);
    return it != object.end() && it->is_number() ? it->get<double>() : otherwise;
}

// Lines are read as they are: a member of an unexpected type reads as missing, never throws.
std::int64_t integer(const Json& object, const char* key, std::int64_t otherwise = 0) {
    const auto it = object.find(key);
    return it != object.end() && it->is_number_integer() ? it->get<std::int64_t>() : otherwise;
}

bool flag(const Json& object, const char* key) {
    const auto it = object.find(key);
    return it != object.end() && it->is_boolean() && it->get<bool>();
}

// Each whole line of one sink, parsed, with its time; counts the sink's files as it goes.
void readSink(const std::filesystem::path& sinksDir, const std::string& sink,
              ReportSinkFiles& files, const std::function<void(double, const Json&)>& take) {
    for (const auto& segment : QVReportingListSinkSegments(sinksDir, sink)) {
        std::error_code ec;
        const auto size = std::filesystem::file_size(segment.path, ec);
        files.bytes += ec ? 0 : size;
        ++files.segments;
    }
    SinkLineReader reader(sinksDir, sink, 0);
    while (auto line = reader.next()) {
        const std::uint64_t expected = files.lines == 0 ? 1 : files.lastSeq + 1;
        files.linesMissing += line->seq - expected;
        if (files.lines++ == 0) {
            files.firstSeq = line->seq;
        }
        files.lastSeq = line->seq;
        const Json parsed = Json::parse(line->text, nullptr, false);
        if (!parsed.is_object() || !parsed.contains("time") || !parsed["time"].is_number()) {
            ++files.linesUnreadable;
            continue;
        }
        take(parsed["time"].get<double>(), parsed);
    }
}

// What a message of the mirror is when the daemon derived it at stop, else empty.
std::string derivedKind(std::int64_t category, std::int64_t type) {
    if (category == category::kChannelStats) {
        return "driver stats";
    }
    if (category == category::kSetup && type == type::kSetup) {
        return "device state";
    }
    if (type != type::kSummary) {
        return {};
    }
    switch (category) {
        case category::kVolume:
            return "volume stretch";
        case category::kInput:
            return "input stretch";
        case category::kGeneric:
            return "summary";
        default: {
            std::string name = QVReportingUtilityCategoryString(
                static_cast<AudioEventCategory>(category & 0xFFFF));
            std::transform(name.begin(), name.end(), name.begin(),
                           [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
            return name + " summary";
        }
    }
}

class Gatherer {
  public:
    Gatherer(const std::string& stateDir, const ReportFilter& filter)
        : sinksDir_(std::filesystem::path(stateDir) / "sinks") {
        data_.filter = filter;
    }

    ReportData run() {
        for (const auto& sink : QVReportingListSinks(sinksDir_)) {
            auto& files = data_.sinks[sink];
            if (sink == "convo") {
                readSink(sinksDir_, sink, files, [&](double t, const Json& l) { convo(t, l); });
            } else if (sink == "analytics") {
                readSink(sinksDir_, sink, files, [&](double t, const Json& l) { analytics(t, l); });
            } else if (sink == "mtx") {
                readSink(sinksDir_, sink, files, [&](double t, const Json& l) { mtx(t, l); });
            } else if (sink == "issuecapture" || sink == "diagnostics" || sink == "issuefiler") {
                readSink(sinksDir_, sink, files,
                         [&](double t, const Json& l) { diagnostic(sink, t, l); });
            } else {
                readSink(sinksDir_, sink, files, [](double, const Json&) {});
            }
        }
        finish();
        return std::move(data_);
    }

  private:
    bool wanted(double time, const std::string& application) const {
        const auto& f = data_.filter;
        return f.contains(time) && (f.application.empty() || f.application == application);
    }

    void convo(double time, const Json& line) {
        const std::string op = text(line, "op");
        const auto number = integer(line, "session", -1);
        if (op == "session") {
            ReportSession s;
            const Json& info = line.value("sessionInfo", Json::object());
            const Json& user = line.value("userInfo", Json::object());
            s.reporterID = integer(info, "SessionID");
            s.application = text(info, "ClientBundleID");
            s.service = text(user, "ServiceName");
            if (s.service.ends_with(kSessionSuffix)) {
                s.service.resize(s.service.size() - kSessionSuffix.size());
            }
            s.start = s.end = time;
            // Numbers start again with each run of the daemon: the newest session holds one.
            open_[number] = allSessions_.size();
            allSessions_.push_back(std::move(s));
            return;
        }
        const auto it = open_.find(number);
        if (it == open_.end()) {
            return;
        }
        ReportSession& s = allSessions_[it->second];
        s.end = std::max(s.end, time);
        if (op == "flush") {
            s.stopped = true;
            open_.erase(it);
            return;
        }
        if (op != "message") {
            return;
        }
        const auto category = integer(line, "category");
        const auto type = integer(line, "type");
        if (category == kConvoSummary && type == kConvoSummary) {
            return;
        }
        const std::string derived = derivedKind(category, type);
        if (!derived.empty()) {
            ++s.derived[derived];
            return;
        }
        ++s.messages;
        const std::string issue = text(line.value("payload", Json::object()), "issue_type");
        if (!issue.empty()) {
            ++s.issues[issue];
        }
    }

    void analytics(double time, const Json& line) {
        const std::string event = text(line, "event");
        if (!event.starts_with(kAnalyticsPrefix)) {
            return;
        }
        const std::string_view name = std::string_view(event).substr(kAnalyticsPrefix.size());
        const Json& payload = line.value("payload", Json::object());
        const std::string application = text(payload, "HostApplicationDisplayID");
        if (!wanted(time, application)) {
            return;
        }
        std::string device = text(payload, "active_devices");
        if (device.empty()) {
            device = "(none)";
        }
        if (name == "Volume.Summary") {
            const double seconds = number(payload, "play_seconds");
            data_.usage[application][device].playSeconds += seconds;
            // A session's stretches are derived together, numbered from 1.
            auto& playback = playing_[application];
            if (number(payload, "msgidx") <= 1 || playback == nullptr) {
                playbacks_.push_back({application, time, {}});
                playback = &playbacks_.back();
            }
            playback->stretches.push_back({seconds, number(payload, "KXSessionVolume"), device});
            see(time);
        } else if (name == "Input.Summary") {
            data_.usage[application][device].recordSeconds +=
                number(payload, "inputrunning_seconds");
            see(time);
        } else if (text(payload, "issue_type") == "overload") {
            std::string detail = std::string(name);
            const double frames = number(payload, "smallest_buffer_frame_size", -1);
            if (frames >= 0) {
                detail += ", " + text(payload, "smallest_buffer_frame_size") + " frames";
            }
            addIssue(ReportIssue::Kind::kOverload, time, application, detail);
        }
    }

    void mtx(double time, const Json& line) {
        Json copy = line;
        QVReportingCtlDecodeMTXRecord(copy, true);
        const Json& decoded = copy.value("decoded", Json());
        if (!decoded.is_object()) {
            addIssue(ReportIssue::Kind::kMTXRecord, time, {}, "record does not decode");
            return;
        }
        const std::string application = text(decoded, "rtaidclient");
        std::string detail = text(decoded, "issuetype");
        if (const std::string node = text(decoded, "node"); !node.empty()) {
            detail += " on node " + node;
        }
        if (const double duration = number(decoded, "duration"); duration > 0) {
            detail += ", " + text(decoded, "duration") + " s";
        }
        addIssue(ReportIssue::Kind::kMTXRecord, time, application, detail);
    }

    void diagnostic(const std::string& sink, double time, const Json& line) {
        const std::string op = text(line, "op");
        // A request the service refused (throttled, over the daily limit) has no sessionID: no
        // capture was taken for it.
        if (sink == "issuecapture" && (op == "snapshot" || op == "session") &&
            line.contains("sessionID")) {
            const Json& signature = line.value("signature", Json::object());
            captures_.push_back({ReportIssue::Kind::kCapture,
                                 time,
                                 {},
                                 text(signature, "type") + " / " + text(signature, "subtype") +
                                     " / " + text(signature, "subtypeContext")});
            captureServices_.push_back(text(signature, "type"));
        } else if (sink == "diagnostics" && op == "request") {
            addIssue(ReportIssue::Kind::kStackSample, time, text(line, "description"),
                     text(line, "kind") + (flag(line, "sampled") ? ", sampled" : ", not sampled"));
        } else if (sink == "issuefiler" && op == "draft") {
            addIssue(ReportIssue::Kind::kBugReport, time, text(line, "processName"),
                     text(line, "title"));
        }
    }

    void addIssue(ReportIssue::Kind kind, double time, const std::string& application,
                  std::string detail) {
        if (wanted(time, application)) {
            data_.issues.push_back({kind, time, application, std::move(detail)});
            see(time);
        }
    }

    void see(double time) {
        data_.first = data_.first == 0 ? time : std::min(data_.first, time);
        data_.last = std::max(data_.last, time);
    }

    // A capture names no session: it belongs to the session of its signature's service that
    // was running when it was asked for. Its line is written on another thread when the capture
    // is taken, so one asked at a session's stop can land after the session's last line, or
    // before its first when that is written at the stop too: then it is the session of the
    // service nearest to it in time, the latest of equals.
    void finish() {
        for (std::size_t i = 0; i < captures_.size(); ++i) {
            ReportIssue& capture = captures_[i];
            ReportSession* owner = nullptr;
            double nearest = 0;
            for (auto s = allSessions_.rbegin(); s != allSessions_.rend(); ++s) {
                if (s->service != captureServices_[i]) {
                    continue;
                }
                const double away = capture.time < s->start ? s->start - capture.time
                                    : s->stopped            ? std::max(0.0, capture.time - s->end)
                                                            : 0.0;
                if (!owner || away < nearest) {
                    owner = &*s;
                    nearest = away;
                }
            }
            if (owner) {
                ++owner->captures;
                capture.application = owner->application;
            }
            addIssue(capture.kind, capture.time, capture.application, capture.detail);
        }
        for (auto& s : allSessions_) {
            if (wanted(s.start, s.application)) {
                see(s.start);
                see(s.end);
                data_.sessions.push_back(std::move(s));
            }
        }
        const auto byTime = [](const auto& a, const auto& b) { return a.time < b.time; };
        std::stable_sort(data_.issues.begin(), data_.issues.end(), byTime);
        data_.playbacks.assign(playbacks_.begin(), playbacks_.end());
        std::stable_sort(data_.playbacks.begin(), data_.playbacks.end(), byTime);
    }

    const std::filesystem::path sinksDir_;
    ReportData data_;
    std::vector<ReportSession> allSessions_;
    std::map<std::int64_t, std::size_t> open_;  // convo session number -> allSessions_
    std::vector<ReportIssue> captures_;
    std::vector<std::string> captureServices_;
    // A list, so that the pointers of playing_ stay valid as it grows.
    std::list<ReportPlayback> playbacks_;
    std::map<std::string, ReportPlayback*> playing_;
};

bool digits(std::string_view text, std::size_t at, std::size_t count, int& out) {
    if (at + count > text.size()) {
        return false;
    }
    const char* begin = text.data() + at;
    const auto [end, error] = std::from_chars(begin, begin + count, out);
    return error == std::errc() && end == begin + count;
}

}  // namespace

bool ReportFilter::contains(double time) const {
    return (!since || time >= *since) && (!until || time < *until);
}

std::string_view QVReportingCtlIssueKindName(ReportIssue::Kind kind) {
    switch (kind) {
        case ReportIssue::Kind::kMTXRecord:
            return "MTX record";
        case ReportIssue::Kind::kOverload:
            return "overload";
        case ReportIssue::Kind::kCapture:
            return "capture";
        case ReportIssue::Kind::kStackSample:
            return "stack sample";
        case ReportIssue::Kind::kBugReport:
            return "bug report";
    }
    return "?";
}

std::string QVReportingCtlCountsText(const std::map<std::string, std::size_t>& counts) {
    std::string out;
    for (const auto& [what, n] : counts) {
        out += (out.empty() ? "" : ", ") + what + (n == 1 ? "" : " x" + std::to_string(n));
    }
    return out.empty() ? "-" : out;
}

std::string QVReportingCtlShortUTC(double secondsSince1970) {
    std::string text = QVReportingCtlFormatUTC(secondsSince1970);
    if (text.size() >= 19 && text[10] == 'T') {
        text.resize(19);
        text[10] = ' ';
    }
    return text;
}

std::string QVReportingCtlSessionIssuesText(const ReportSession& session) {
    auto counts = session.issues;
    if (session.captures > 0) {
        counts["capture"] += session.captures;
    }
    return QVReportingCtlCountsText(counts);
}

ReportData QVReportingCtlGatherReport(const std::string& stateDir, const ReportFilter& filter) {
    std::error_code ec;
    if (!std::filesystem::is_directory(stateDir, ec)) {
        throw std::runtime_error("no state directory " + stateDir);
    }
    const auto sinks = std::filesystem::path(stateDir) / "sinks";
    if (!std::filesystem::is_directory(sinks, ec)) {
        throw std::runtime_error("no sinks directory " + sinks.string() +
                                 " (has the daemon run with this state directory?)");
    }
    return Gatherer(stateDir, filter).run();
}

std::optional<double> QVReportingCtlParseReportTime(std::string_view text) {
    // Seconds since 1970.
    if (!text.empty() && text.find_first_not_of("0123456789.") == std::string_view::npos) {
        double seconds = 0;
        const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), seconds);
        if (error != std::errc() || end != text.data() + text.size()) {
            return std::nullopt;
        }
        return seconds;
    }
    // YYYY-MM-DD[(T| )HH:MM[:SS[.fff]]][Z|(+|-)HH[:]MM]
    std::tm tm{};
    if (!digits(text, 0, 4, tm.tm_year) || text.size() < 10 || text[4] != '-' || text[7] != '-' ||
        !digits(text, 5, 2, tm.tm_mon) || !digits(text, 8, 2, tm.tm_mday)) {
        return std::nullopt;
    }
    if (tm.tm_mon < 1 || tm.tm_mon > 12 || tm.tm_mday < 1 || tm.tm_mday > 31) {
        return std::nullopt;
    }
    std::size_t at = 10;
    double fraction = 0;
    if (at < text.size() && (text[at] == 'T' || text[at] == ' ')) {
        if (!digits(text, at + 1, 2, tm.tm_hour) || text.size() < at + 6 || text[at + 3] != ':' ||
            !digits(text, at + 4, 2, tm.tm_min) || tm.tm_hour > 23 || tm.tm_min > 59) {
            return std::nullopt;
        }
        at += 6;
        if (at < text.size() && text[at] == ':') {
            if (!digits(text, at + 1, 2, tm.tm_sec) || tm.tm_sec > 60) {
                return std::nullopt;
            }
            at += 3;
            if (at < text.size() && text[at] == '.') {
                const std::size_t end = text.find_first_not_of("0123456789", at + 1);
                const std::size_t stop = end == std::string_view::npos ? text.size() : end;
                if (stop == at + 1) {
                    return std::nullopt;
                }
                const std::string part = "0" + std::string(text.substr(at, stop - at));
                fraction = std::stod(part);
                at = stop;
            }
        }
    }
    tm.tm_year -= 1900;
    tm.tm_mon -= 1;
    const std::string_view zone = text.substr(at);
    std::time_t whole;
    if (zone.empty()) {
        tm.tm_isdst = -1;
        whole = std::mktime(&tm);
    } else {
        int offset = 0;
        if (zone != "Z") {
            int hours = 0, minutes = 0;
            const bool colon = zone.size() == 6 && zone[3] == ':';
            if ((zone[0] != '+' && zone[0] != '-') || (zone.size() != 5 && !colon) ||
                !digits(zone, 1, 2, hours) || !digits(zone, colon ? 4 : 3, 2, minutes) ||
                hours > 23 || minutes > 59) {
                return std::nullopt;
            }
            offset = (zone[0] == '-' ? -1 : 1) * (hours * 3600 + minutes * 60);
        }
        whole = timegm(&tm) - offset;
    }
    if (whole == static_cast<std::time_t>(-1)) {
        return std::nullopt;
    }
    return static_cast<double>(whole) + fraction;
}

}  // namespace qv::client
