#include "platform/linux/LinuxAnalyticsService.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <filesystem>
#include <fstream>

#include <fmt/format.h>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "fakes/FakeClock.h"
#include "fakes/TempDirectory.h"

namespace qv {
namespace {

namespace fs = std::filesystem;
using nlohmann::ordered_json;

class ALinuxAnalyticsService : public ::testing::Test {
  protected:
    // A service over root/state, with an events file holding listing when one is given.
    std::unique_ptr<LinuxAnalyticsService> make(const std::string* listing = nullptr) {
        std::string eventsFile;
        if (listing) {
            eventsFile = (root / "events.txt").string();
            std::ofstream(eventsFile, std::ios::binary) << *listing;
        }
        auto created = LinuxAnalyticsService::create((root / "state").string(), clock, eventsFile,
                                                     {[this](std::string_view) { ++lost; }, {}});
        EXPECT_TRUE(created.error.empty()) << created.error;
        return std::move(created.service);
    }
    std::vector<ordered_json> recorded() const {
        std::ifstream in(root / "state" / "sinks" / "analytics.jsonl");
        std::vector<ordered_json> lines;
        for (std::string line; std::getline(in, line);) {
            lines.push_back(ordered_json::parse(line));
        }
        return lines;
    }

    test::TempDirectory tmp{"qvanalytics"};
    const fs::path root = tmp.path();
    test::FakeClock clock;
    std::atomic<int> lost{0};
};

TEST_F(ALinuxAnalyticsService, UsesEveryEventWithoutAFileAndOnlyTheNamesAndGlobsItLists) {
    auto open = make();
    ASSERT_TRUE(open);
    EXPECT_TRUE(open->isEventUsed("com.korvane.qvsound.Playback.Start"));
    EXPECT_TRUE(open->isEventUsed(""));

    const std::string listing =
        "# events the pipeline consumes\n"
        "\n"
        "   \t\n"
        "  com.korvane.qvsound.Playback.Start  \r\n"
        "com.korvane.*.Volume.*\n"
        "#com.korvane.hidden\n"
        "com.korvane.qvsound.Setup.St?p\n"
        "com.korvane.telephony.[!O]*.Summary";  // no final line break
    auto service = make(&listing);
    ASSERT_TRUE(service);
    const struct {
        const char* name;
        bool used;
    } cases[] = {
        {"com.korvane.qvsound.Playback.Start", true},
        {"com.korvane.qvsound.Playback.Start.extra", false},
        {"com.korvane.qvsound.Playback.Stop", false},
        {"com.korvane.qvsound.playback.start", false},  // names are case-sensitive
        {"com.korvane.qvsound.Volume.Summary", true},
        {"com.korvane.telephony.Volume.Start", true},
        {"com.korvane.Volume", false},
        {"com.korvane.qvsound.Setup.Stop", true},
        {"com.korvane.qvsound.Setup.Stoop", false},
        {"com.korvane.telephony.Input.Summary", true},
        {"com.korvane.telephony.IO.Summary", true},
        {"com.korvane.telephony.Output.Summary", false},
        {"#com.korvane.hidden", false},
        {"com.korvane.hidden", false},
        {"", false},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(service->isEventUsed(c.name), c.used) << c.name;
    }

    // A file that lists nothing turns every event off.
    const std::string onlyComments = "# nothing in use\n\n";
    auto silent = make(&onlyComments);
    ASSERT_TRUE(silent);
    EXPECT_FALSE(silent->isEventUsed("com.korvane.qvsound.Playback.Start"));
}

TEST_F(ALinuxAnalyticsService, BuildsThePayloadAtOnceAndOnlyForEventsInUse) {
    const std::string listing = "com.korvane.qvsound.*\n";
    auto service = make(&listing);
    ASSERT_TRUE(service);
    int calls = 0;
    service->sendEventLazy("com.korvane.telephony.Playback.Start", [&] {
        ++calls;
        return Dictionary{{"unused", true}};
    });
    EXPECT_EQ(calls, 0);

    Dictionary source{{"v", 1}};
    service->sendEventLazy("com.korvane.qvsound.Playback.Start", [&] {
        ++calls;
        return source;
    });
    EXPECT_EQ(calls, 1) << "called before sendEventLazy returns";
    source.set("v", 2);  // a later change must not reach the recorded event
    service->sendEventLazy("com.korvane.qvsound.Playback.Stop", {});  // no producer: ignored
    service->flush();

    const auto lines = recorded();
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].dump(), fmt::format(R"({{"time":{:.1f},"event":"{}","payload":{{"v":1}}}})",
                                           clock.now(), "com.korvane.qvsound.Playback.Start"));
    EXPECT_EQ(lost, 0);
}

TEST_F(ALinuxAnalyticsService, RefusesAnEventsFileItCannotRead) {
    const SinkCallbacks none;
    auto missing = LinuxAnalyticsService::create((root / "state").string(), clock,
                                                 (root / "no-such-file").string(), none);
    EXPECT_FALSE(missing.service);
    EXPECT_NE(missing.error.find("no-such-file"), std::string::npos) << missing.error;

    // A directory opens but cannot be read: an error, not an empty list of events.
    fs::create_directories(root / "adir");
    auto directory = LinuxAnalyticsService::create((root / "state").string(), clock,
                                                   (root / "adir").string(), none);
    EXPECT_FALSE(directory.service);
    EXPECT_NE(directory.error.find("adir"), std::string::npos) << directory.error;
}

}  // namespace
}  // namespace qv
