#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include <fmt/format.h>
#include <gtest/gtest.h>

#include "QVReportingCtlReportData.h"
#include "fakes/TempDirectory.h"

namespace qv::client {
namespace {

namespace fs = std::filesystem;

TEST(TheReportTimes, ReadSinkSecondsAndISODatesWithTheirZonesAndNothingElse) {
    ::setenv("TZ", "UTC", 1);
    ::tzset();
    constexpr double kDay = 1795651200;  // 2026-11-26T00:00:00Z
    const std::pair<const char*, std::optional<double>> cases[] = {
        {"1795686753.25", 1795686753.25},
        {"0", 0.0},
        {"2026-11-26", kDay},
        {"2026-11-26T09:52", kDay + 9 * 3600 + 52 * 60},
        {"2026-11-26 09:52:33", kDay + 9 * 3600 + 52 * 60 + 33},
        {"2026-11-26T09:52:33.25Z", kDay + 9 * 3600 + 52 * 60 + 33.25},
        {"2026-11-26T09:52:33+01:00", kDay + 8 * 3600 + 52 * 60 + 33},
        {"2026-11-26T09:52-0230", kDay + 12 * 3600 + 22 * 60},
        {"2026-11-26T23:59:60Z", kDay + 86400},  // a leap second runs on into the next day
        {"", std::nullopt},
        {"-5", std::nullopt},
        {"1e9", std::nullopt},
        {"1.2.3", std::nullopt},
        {"2026-13-01", std::nullopt},
        {"2026-11-00", std::nullopt},
        {"2026-11-26T24:00", std::nullopt},
        {"2026-11-26T09", std::nullopt},
        {"2026-11-26T09:60", std::nullopt},
        {"2026-11-26T09:52:33.", std::nullopt},
        {"2026-11-26T09:52:33.5Q", std::nullopt},
        {"2026-11-26T09:52+1", std::nullopt},
        {"2026-11-26T09:52+24:00", std::nullopt},
        {"26-11-2026", std::nullopt},
    };
    for (const auto& [text, expected] : cases) {
        const auto parsed = QVReportingCtlParseReportTime(text);
        ASSERT_EQ(parsed.has_value(), expected.has_value()) << '"' << text << '"';
        if (expected) {
            EXPECT_DOUBLE_EQ(*parsed, *expected) << '"' << text << '"';
        }
    }
}

// A state directory written by hand as the daemon writes it: two runs of the daemon (convo session
// numbers start again), a rotated analytics sink with lines removed by the budget, a torn line.
class TheReportData : public ::testing::Test {
  protected:
    void SetUp() override {
        fs::create_directories(root_ / "sinks");

        // First run: a music session (5) and a recorder session (7), both stopped.
        convo(
            100,
            R"("op":"session","session":1,"sessionInfo":{"SessionID":5,"ClientBundleID":"music"},"userInfo":{"ServiceName":"longformaudio_session"})");
        message(101, 1, 5, 4, 1);
        convo(
            102,
            R"("op":"session","session":2,"sessionInfo":{"SessionID":7,"ClientBundleID":"rec"},"userInfo":{"ServiceName":"telephony_session"})");
        message(103, 1, 5, 7, 6, R"({"issue_type":"overload"})");
        message(110, 1, 5, 14, 11);
        message(110, 1, 5, 14, 11);
        message(110, 1, 5, 1, 11);
        message(110, 1, 5, 65535, 65535);
        convo(110, R"("op":"flush","session":1,"sessionID":5)");
        message(120, 2, 7, 3, 11);
        convo(121, R"("op":"flush","session":2,"sessionID":7)");
        // A capture the music session asked for at its stop, written after the stop.
        write(
            "issuecapture.jsonl", 1, 111,
            R"("op":"snapshot","signature":{"type":"longformaudio","subtype":"Playback","subtypeContext":"EnergyLog"},"sessionID":"a")");
        // Second run: session number 1 again, a haptics session that asked for a capture at once
        // and was never flushed (the daemon was killed). The capture's line came first.
        convo(
            200,
            R"("op":"session","session":1,"sessionInfo":{"SessionID":9},"userInfo":{"ServiceName":"haptics_session"})");
        message(201, 1, 9, 7, 7, R"({"issue_type":"silence"})");
        // Members of the wrong type are passed over, not thrown at.
        convo(203, R"("op":"message","session":"1","category":"Volume","type":null)");
        convo(204, R"("op":"message","session":1,"category":"Volume","type":null,"payload":[])");
        write(
            "issuecapture.jsonl", 2, 199.5,
            R"("op":"snapshot","signature":{"type":"haptics","subtype":"Playback","subtypeContext":"EnergyLog"},"sessionID":"b")");
        // The same asked for again and refused as too soon: no capture.
        write(
            "issuecapture.jsonl", 3, 202.5,
            R"("op":"snapshot","signature":{"type":"haptics","subtype":"Playback","subtypeContext":"EnergyLog"})");
        write("mtx.jsonl", 1, 201,
              R"("metric":5963779,"record":"EAMaB3NpbGVuY2UiAjEyKhFjb20uZXhhbXBsZS5yYWNlcg==")");

        // Analytics: seq 1-2 went with a closed segment the budget removed; 3-6 are closed, then
        // the current segment, where line 8 is not JSON.
        const char* kClosed = "analytics.000000000003.jsonl";
        volume(kClosed, 3, 110, "music", 1, 0.5, 6, "Speaker");
        volume(kClosed, 4, 110, "music", 2, 0.75, 4, "Headphones");
        write(
            kClosed, 5, 110,
            R"("event":"com.korvane.longformaudio.Volume.Summary","payload":{"HostApplicationDisplayID":"music","msgidx":1,"play_seconds":99,"KXSessionVolume":0.1})");
        write(
            kClosed, 6, 103,
            R"("event":"com.korvane.qvsound.IO.Error","payload":{"HostApplicationDisplayID":"music","issue_type":"overload","smallest_buffer_frame_size":512})");
        write(
            "analytics.jsonl", 7, 120,
            R"("event":"com.korvane.qvsound.Input.Summary","payload":{"HostApplicationDisplayID":"rec","inputrunning_seconds":3.5,"active_devices":"BuiltInMic"})");
        append("analytics.jsonl", "{\"time\":125,\"seq\":8,not json}\n");
        volume("analytics.jsonl", 9, 130, "music", 1, 1.0, 2, "Speaker");
    }
    void append(const std::string& file, const std::string& text) {
        std::ofstream(root_ / "sinks" / file, std::ios::app) << text;
    }
    void write(const std::string& file, std::uint64_t seq, double time, const std::string& rest) {
        append(file, fmt::format("{{\"time\":{},\"seq\":{},{}}}\n", time, seq, rest));
    }
    void convo(double time, const std::string& rest) {
        write("convo.jsonl", ++convoSeq_, time, rest);
    }
    void message(double time, int session, int sessionID, int category, int type,
                 const char* payload = "{}") {
        convo(
            time,
            fmt::format(
                R"("op":"message","session":{},"sessionID":{},"category":{},"type":{},"payload":{})",
                session, sessionID, category, type, payload));
    }
    void volume(const std::string& file, std::uint64_t seq, double time, const std::string& app,
                int index, double volume, double seconds, const std::string& device) {
        write(
            file, seq, time,
            fmt::format(
                R"("event":"com.korvane.qvsound.Volume.Summary","payload":{{"HostApplicationDisplayID":"{}","msgidx":{},"KXSessionVolume":{},"play_seconds":{},"active_devices":"{}"}})",
                app, index, volume, seconds, device));
    }
    ReportData gather(ReportFilter filter = {}) {
        return QVReportingCtlGatherReport(root_.string(), filter);
    }

    test::TempDirectory tmp_{"qv-report"};
    const fs::path root_ = tmp_.path();
    std::uint64_t convoSeq_ = 0;
};

TEST_F(TheReportData, GroupsEachSessionsMessagesAcrossDaemonRunsAndSegments) {
    const ReportData data = gather();
    ASSERT_EQ(data.sessions.size(), 3u);
    const auto& music = data.sessions[0];
    EXPECT_EQ(std::tie(music.reporterID, music.application, music.service, music.stopped),
              std::tuple(5, "music", "longformaudio", true));
    EXPECT_DOUBLE_EQ(music.end - music.start, 10);
    EXPECT_EQ(music.messages, 2u);  // the mirror's folded summary is not a message
    EXPECT_EQ(QVReportingCtlCountsText(music.derived), "summary, volume stretch x2");
    EXPECT_EQ(QVReportingCtlSessionIssuesText(music), "capture, overload");
    EXPECT_EQ(QVReportingCtlCountsText(data.sessions[1].derived), "input stretch");
    const auto& haptics = data.sessions[2];
    EXPECT_EQ(haptics.service, "haptics");
    EXPECT_EQ(haptics.messages, 2u);
    EXPECT_FALSE(haptics.stopped);
    EXPECT_EQ(QVReportingCtlSessionIssuesText(haptics), "capture, silence");

    // Playback time counts each stretch once (the service-named event is the same message).
    EXPECT_DOUBLE_EQ(data.usage.at("music").at("Speaker").playSeconds, 8);
    EXPECT_DOUBLE_EQ(data.usage.at("music").at("Headphones").playSeconds, 4);
    EXPECT_DOUBLE_EQ(data.usage.at("rec").at("BuiltInMic").recordSeconds, 3.5);
    ASSERT_EQ(data.playbacks.size(), 2u);
    EXPECT_EQ(data.playbacks[0].stretches.size(), 2u);
    EXPECT_DOUBLE_EQ(data.playbacks[0].stretches[1].volume, 0.75);
    EXPECT_EQ(data.playbacks[1].stretches.size(), 1u);

    std::vector<std::string> issues;
    for (const auto& issue : data.issues) {
        issues.push_back(fmt::format("{} {} {} {}", issue.time,
                                     QVReportingCtlIssueKindName(issue.kind), issue.application,
                                     issue.detail));
    }
    EXPECT_EQ(issues, (std::vector<std::string>{
                          "103 overload music IO.Error, 512 frames",
                          "111 capture music longformaudio / Playback / EnergyLog",
                          "199.5 capture  haptics / Playback / EnergyLog",
                          "201 MTX record com.example.racer silence on node 12, 3 s",
                      }));

    // Segments, lines, seqs from and to, missing (1 and 2), unreadable.
    const auto& a = data.sinks.at("analytics");
    EXPECT_EQ(
        std::tie(a.segments, a.lines, a.firstSeq, a.lastSeq, a.linesMissing, a.linesUnreadable),
        std::tuple(2u, 7u, 3u, 9u, 2u, 1u));
    EXPECT_EQ(data.sinks.at("convo").lines, 15u);
    EXPECT_EQ(data.sinks.at("convo").linesUnreadable, 0u);
    EXPECT_DOUBLE_EQ(data.first, 100);
    EXPECT_DOUBLE_EQ(data.last, 204);  // the unflushed session's last message
}

TEST_F(TheReportData, KeepsWhatLiesFromSinceUpToUntilAndOneApplication) {
    struct Case {
        std::optional<double> since, until;
        std::string app;
        std::size_t sessions, playbacks, issues;
    };
    const Case cases[] = {
        {100, 102, "", 1, 0, 0},           // the session at 102 is left out
        {102, 199.5, "", 1, 2, 2},         // since is kept, until is not
        {110, std::nullopt, "", 1, 2, 3},  // stretches from 110, issues at 111, 199.5 and 201
        {std::nullopt, std::nullopt, "music", 1, 2, 2},
        {std::nullopt, std::nullopt, "nobody", 0, 0, 0},
    };
    for (const auto& c : cases) {
        const ReportData data = gather({c.since, c.until, c.app});
        const std::string what =
            fmt::format("[{}, {}) {}", c.since.value_or(-1), c.until.value_or(-1), c.app);
        EXPECT_EQ(data.sessions.size(), c.sessions) << what;
        EXPECT_EQ(data.playbacks.size(), c.playbacks) << what;
        EXPECT_EQ(data.issues.size(), c.issues) << what;
        EXPECT_EQ(data.empty(), c.sessions + c.playbacks + c.issues == 0) << what;
    }
    EXPECT_THROW(QVReportingCtlGatherReport((root_ / "sinks").string(), {}), std::runtime_error);
}

}  // namespace
}  // namespace qv::client
