#include "QVBridgeReporter.h"

#include <gtest/gtest.h>

namespace qv::bridge {
namespace {

using Kind = QVBridgeEvent::Kind;

QVBridgeStreamState playing(bool running = true) {
    QVBridgeStreamState s;
    s.nodeID = 40;
    s.role = "Music";
    s.applicationID = "player";
    s.nodeName = "player-node";
    s.running = running;
    s.volume = 1.0;
    s.device = "Speaker";
    s.format = "F32LE 48000 Hz 2 ch";
    s.sampleFormat = "F32LE";
    s.channels = 2;
    return s;
}

// "kind category/type" of each event, for tables.
std::vector<std::string> shape(const std::vector<QVBridgeEvent>& events) {
    std::vector<std::string> out;
    for (const auto& e : events) {
        out.push_back(e.kind == Kind::kOpen    ? "open " + std::to_string(e.serviceType)
                      : e.kind == Kind::kStart ? "start"
                      : e.kind == Kind::kClose
                          ? "close"
                          : std::to_string(e.category) + "," + std::to_string(e.type));
    }
    return out;
}

using Shape = std::vector<std::string>;

TEST(QVBridgeReporter, ASessionIsOpenedAtOnceButStartedOnlyOnTheFirstRun) {
    QVBridgeReporter r(100);
    auto idle = playing(false);
    EXPECT_EQ(shape(r.update(idle)), (Shape{"open 7"}));
    idle.volume = 0.5;  // changes before the first run ride on its Start
    EXPECT_EQ(shape(r.update(idle)), Shape{});
    // What the Start holds is the Playback end-to-end test's.
    const auto events = r.update(playing());
    EXPECT_EQ(shape(events), (Shape{"start", "4,1"}));
    EXPECT_EQ(events[1].reporterID, 100);
}

TEST(QVBridgeReporter, EachChangeOfARunningStreamIsItsOwnMessage) {
    struct Step {
        const char* what;
        void (*change)(QVBridgeStreamState&);
        Shape expected;
    };
    const Step steps[] = {
        {"volume", [](QVBridgeStreamState& s) { s.volume = 0.5; }, {"14,18"}},
        {"same again", [](QVBridgeStreamState&) {}, {}},
        {"moved", [](QVBridgeStreamState& s) { s.device = "Headphones"; }, {"10,18"}},
        {"format", [](QVBridgeStreamState& s) { s.format = "S16LE 44100 Hz 2 ch"; }, {"5,18"}},
        {"channels", [](QVBridgeStreamState& s) { s.channels = 1; }, {"5,18"}},
        {"volume and move",
         [](QVBridgeStreamState& s) {
             s.volume = 0.25;
             s.device = "Speaker";
         },
         {"14,18", "10,18"}},
        {"paused, with a volume change riding on the stop",
         [](QVBridgeStreamState& s) {
             s.running = false;
             s.volume = 0.75;
         },
         {"4,2"}},
        {"volume while paused", [](QVBridgeStreamState& s) { s.volume = 0.5; }, {"14,18"}},
        {"resumed", [](QVBridgeStreamState& s) { s.running = true; }, {"4,1"}},
    };
    QVBridgeReporter r(1);
    auto state = playing();
    r.update(state);
    for (const Step& step : steps) {
        step.change(state);
        EXPECT_EQ(shape(r.update(state)), step.expected) << step.what;
    }
}

// A recording's start and stop are the Recording end-to-end test's; its format changes are not.
TEST(QVBridgeReporter, RecordingUsesTheInputCategories) {
    QVBridgeReporter r(1);
    auto s = playing();
    s.output = false;
    s.role = "Communication";
    EXPECT_EQ(shape(r.update(s)), (Shape{"open 2", "start", "2,1"}));
    s.format = "S16LE 16000 Hz 1 ch";
    EXPECT_EQ(shape(r.update(s)), (Shape{"3,18"}));
}

TEST(QVBridgeReporter, RemovalStopsOnlyWhatRuns) {
    QVBridgeReporter r(1);
    r.update(playing(false));
    EXPECT_EQ(shape(r.remove(40)), (Shape{"close"}));  // never ran
    EXPECT_EQ(shape(r.remove(40)), Shape{});           // gone already
    r.update(playing());
    r.update(playing(false));
    EXPECT_EQ(shape(r.remove(40)), (Shape{"close"}));  // ran, now paused
    auto a = playing();
    auto b = playing();
    b.nodeID = 41;
    r.update(a);
    r.update(b);
    EXPECT_EQ(shape(r.removeAll()), (Shape{"4,2", "close", "4,2", "close"}));
    EXPECT_EQ(r.size(), 0u);
}

TEST(QVBridgeReporter, XrunsAccumulateIntoOverloadErrorsOfStartedSessions) {
    QVBridgeReporter r(1);
    r.update(playing(false));
    EXPECT_TRUE(r.xruns(40, 3, 1024, "speakers").empty());  // not started: counted only
    r.update(playing());
    EXPECT_TRUE(r.xruns(40, 0, 1024, "speakers").empty());
    EXPECT_TRUE(r.xruns(99, 1, 1024, "speakers").empty());  // not a stream of ours
    const auto e = r.xruns(40, 2, 1024, "speakers");
    ASSERT_EQ(shape(e), (Shape{"7,6"}));
    const auto& p = e[0].payload;
    EXPECT_EQ(std::get<std::int64_t>(*QVBridgePayloadFind(p, "smallest_buffer_frame_size")), 1024);
    EXPECT_EQ(std::get<std::int64_t>(*QVBridgePayloadFind(p, "io_cycle")), 5);
    EXPECT_EQ(std::get<std::int64_t>(*QVBridgePayloadFind(p, "xrun_count")), 2);
}

TEST(QVBridgeReporter, ReporterIDsAreNeverReused) {
    QVBridgeReporter r(7);
    EXPECT_EQ(r.update(playing(false))[0].reporterID, 7);
    r.remove(40);
    EXPECT_EQ(r.update(playing(false))[0].reporterID, 8);  // the same node id come back
}

}  // namespace
}  // namespace qv::bridge
