#include "workers/derived/QVReportingSessionInputMessagesWorker.h"

#include <limits>
#include <tuple>

#include "workers/WorkerTestSupport.h"

namespace qv::test {
namespace {

auto on(Value t, Value flag = true) {
    return set(t, "session_input_running", flag);
}
auto off(Value t, Value flag = false) {
    return set(t, "session_input_running", flag);
}
auto codec(Value t, Value name, Value rate, bool starts = false) {
    auto m = at(t, {{"vp_config_primary_vocoder", name}, {"vp_config_primary_vocoderFs", rate}});
    if (starts) {
        m->message().set("session_input_running", true);
    }
    return m;
}
Messages derive(const Platform& platform, const Dictionary& previous, const Messages& in,
                std::optional<std::string_view> process = "recorder") {
    return QVReportingSessionInputMessagesWorker::initWithSession(sessionWith(platform, previous))
        ->createInputMessages(in, process, 0.5);
}

TEST(AnInputMessagesWorker, ReportsStretchesClosedOnlyByStopDurationOrDevices) {
    FakePlatform fake;
    struct Case {
        const char* name;
        Dictionary previous;
        Messages in;
        // Per derived message: running time, its label, "vocoders" ("" when absent), devices.
        std::vector<std::tuple<double, std::string, std::string, std::string>> out;
    };
    const std::vector<Case> cases = {
        {"codecs are listed once and sorted; an idle rate never; a skipped stretch keeps them",
         {},
         {codec(0, "Z", "8000", true), codec(2, "B", "24000"), codec(3, "N", "0.0"),
          codec(4, "Z", "8000"), off(9), codec(10, "C", "16000", true), off(10.5), on(11),
          codec(14, "Q", "0.5"), off(16)},
         {{9, "10", "B:24000,Z:8000", "unknown"}, {5, "5", "C:16000", "unknown"}}},
        {"devices split a stretch; codec and format changes do not; too short keeps the start",
         {},
         {codec(0, "A", "16000", true), set(0.5, "active_devices", "mic"),
          set(2, "session_selected_format", "x"), set(4, "active_devices", "hs"),
          codec(6, "A", "16000"), set(7, "mFormatID", "y"), off(10)},
         {{4, "5", "A:16000", "mic"}, {6, "5", "", "hs"}}},
        {"duration closes a stretch; the stop after it has no start",
         {},
         {on(0), set(3, "session_duration", 3), off(8)},
         {{3, "5", "", "unknown"}}},
        {"input running from before is not counted until it has stopped",
         {{"session_input_running", true}, {"qvreporting_timestamp", 0}},
         {on(1), off(5), on(6), off(8)},
         {{2, "1", "", "unknown"}}},
        {"a spatial burst within 2 s moves a split to its last time, one 3 s apart does not",
         {},
         {on(0), at(1, {{"spatializationEnabled", true}, {"active_devices", "hs"}}),
          set(2.5, "spatial-audio-accessory-feature", true), off(10), on(20),
          at(21, {{"spatializationEnabled", false}, {"active_devices", "bt"}}),
          set(24, "spatial-audio-accessory-feature", false), off(30)},
         {{2.5, "1", "", "unknown"},
          {7.5, "10", "", "hs"},
          {1, "1", "", "hs"},
          {9, "10", "", "bt"}}},
        {"wrong kinds: flags as text or numbers, a numeric codec, unusable times",
         {},
         {on(0, "YES"), codec(0.5, 7, 16000), off(2, 0),
          on(std::numeric_limits<double>::quiet_NaN()), off(5), on(6, 1), off("7"), on(8),
          off(nullptr), on(10), off(true)},
         {{2, "1", "7:16000", "unknown"}}},
    };
    EXPECT_TRUE(derive(fake.platform, {}, cases[0].in, std::nullopt).empty()) << "no process";
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        const Messages out = derive(fake.platform, c.previous, c.in);
        ASSERT_EQ(out.size(), c.out.size());
        for (std::size_t i = 0; i < out.size(); ++i) {
            SCOPED_TRACE(i);
            const auto& [seconds, label, vocoders, devices] = c.out[i];
            const Dictionary& p = out[i]->message();
            EXPECT_EQ(*p.find("inputrunning_seconds"),
                      static_cast<double>(static_cast<float>(seconds)));
            EXPECT_EQ(*p.find("inputrunning_secondsBucketed"), label);
            EXPECT_EQ(*p.find("msgidx"), i + 1);
            EXPECT_EQ(*p.find("msgcnt"), out.size());
            EXPECT_EQ(p.contains("vocoders") ? *p.find("vocoders") : Value(""), vocoders);
            EXPECT_EQ(*p.find("active_devices"), devices);
        }
    }
}

}  // namespace
}  // namespace qv::test
