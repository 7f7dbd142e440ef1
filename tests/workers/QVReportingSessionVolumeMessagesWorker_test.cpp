#include "workers/derived/QVReportingSessionVolumeMessagesWorker.h"

#include <limits>
#include <tuple>

#include "workers/WorkerTestSupport.h"

namespace qv::test {
namespace {

constexpr double kNaN = std::numeric_limits<double>::quiet_NaN();

auto on(Value t, Value volume = nullptr) {
    return volume.isNull() ? set(t, "session_output_running", true)
                           : at(t, {{"session_output_running", true}, {"KXSessionVolume", volume}});
}
auto off(Value t, Value flag = false) {
    return set(t, "session_output_running", flag);
}
Messages derive(const Platform& platform, const Dictionary& previous, const Messages& in,
                std::optional<std::string_view> process = "player") {
    return QVReportingSessionVolumeMessagesWorker::initWithSession(sessionWith(platform, previous))
        ->createVolumeMessages(in, process, 0.5);
}

TEST(AVolumeMessagesWorker, ReportsEachStretchClosedByStopDurationOrAWatchedChange) {
    FakePlatform fake;
    struct Case {
        const char* name;
        Dictionary previous;
        Messages in;
        // Per derived message: play time, its label, entries the payload must hold.
        std::vector<std::tuple<double, std::string, Dictionary>> out;
    };
    // (A volume change closing a stretch: the report's end-to-end test of the playback example.)
    const std::vector<Case> cases = {
        {"the minimum is exclusive; a tie buckets up",
         {},
         {on(0, 0.03125), off(0.5), on(1), off(1.625)},
         {{0.625, "1", {{"KXSessionVolumeBucketed", "0.0625"}}}}},
        {"duration closes, even while output runs on; the first volume is no change",
         {},
         {on(0), set(1, "KXSessionVolume", 0.5), set(2, "mChannelsPerFrame", 6),
          at(3, {{"session_output_running", true}, {"session_duration", 3}}),
          set(5, "session_duration", 5), off(9), on(10), set(20, "mFormatID", "aac")},
         {{3, "5", {{"mChannelsPerFrame", 6}}}, {2, "1", {}}}},
        {"watched keys close stretches while playing, booleans equal numbers",
         {},
         {at(0, {{"session_output_running", true},
                 {"KXSessionVolume", 0.5},
                 {"session_selected_format", "a"},
                 {"active_devices", "spk"}}),
          set(10, "session_selected_format", "b"), set(20, "active_devices", "hp"),
          set(30, "spatializationEnabled", true), set(40, "ringerstate", true),
          set(50, "spatial-audio-accessory-feature", true), set(55, "ringerstate", 1), off(60),
          set(70, "KXSessionVolume", 0.1)},
         {{10, "10", {{"session_selected_format", "a"}, {"active_devices", "spk"}}},
          {10, "10", {{"session_selected_format", "b"}}},
          {10, "10", {{"active_devices", "hp"}, {"spatializationEnabled", false}}},
          {10, "10", {{"spatializationEnabled", true}, {"ringerstate", false}}},
          {20, "30", {{"ringerstate", true}, {"spatial-audio-accessory-feature", true}}}}},
        {"a spatial burst within 5 s is one change at its last time",
         {},
         {on(0, 0.5), set(10, "spatializationEnabled", true),
          set(14, "spatial-audio-accessory-feature", true), off(20)},
         {{14, "10", {{"spatial-audio-accessory-feature", false}}},
          {6, "5", {{"spatial-audio-accessory-feature", true}}}}},
        {"a stretch inherited from earlier is not reported, nor one still playing",
         {{"session_output_running", true}, {"qvreporting_timestamp", 0}, {"KXSessionVolume", 0.5}},
         {set(10, "KXSessionVolume", 0.8), off(20), on(30), off(40), on(45)},
         {{10, "10", {{"KXSessionVolumeBucketed", "0.8125"}}}}},
        {"wrong kinds: flags as text or numbers, text volumes, NaN, unusable times",
         {},
         {on(0, "loud"), off(10, 0),
          at(20, {{"session_output_running", "YES"}, {"KXSessionVolume", kNaN}}),
          set(25, "KXSessionVolume", kNaN), off(30, "NO"), on(40), off("50"), on(kNaN), off(60),
          on(70), off(nullptr), on(80), off(true), on(100, "0.5"), set(105, "KXSessionVolume", 0.5),
          off(120)},
         {{10, "10", {{"KXSessionVolume", "loud"}, {"KXSessionVolumeBucketed", "0.0"}}},
          {10, "10", {}},
          {20, "30", {{"KXSessionVolume", 0.5}, {"KXSessionVolumeBucketed", "0.5"}}}}},
    };
    EXPECT_TRUE(derive(fake.platform, {}, cases[0].in, std::nullopt).empty()) << "no process";
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        const Messages out = derive(fake.platform, c.previous, c.in);
        ASSERT_EQ(out.size(), c.out.size());
        for (std::size_t i = 0; i < out.size(); ++i) {
            const auto& [seconds, label, holds] = c.out[i];
            const Dictionary& p = out[i]->message();
            EXPECT_EQ(*p.find("play_seconds"), static_cast<double>(static_cast<float>(seconds)));
            EXPECT_EQ(*p.find("play_secondsBucketed"), label);
            EXPECT_EQ(*p.find("msgidx"), i + 1);
            EXPECT_EQ(*p.find("msgcnt"), out.size());
            for (const auto& [key, value] : holds) {
                EXPECT_EQ(*p.find(key), value) << i << " " << key;
            }
        }
    }
}

}  // namespace
}  // namespace qv::test
