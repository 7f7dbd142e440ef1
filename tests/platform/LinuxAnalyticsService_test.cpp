#include "platform/linux/LinuxAnalyticsService.h"

#include <gtest/gtest.h>

#include <atomic>
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

    const std::string listing =
        "# events the pipeline consumes\n\n   \t\n"
        "  com.korvane.qvsound.Playback.Start  \r\n"
        "com.korvane.*.Volume.*\n"
        "#com.korvane.hidden\n"
        "com.korvane.qvsound.Setup.St?p\n"
        "com.korvane.telephony.[!O]*.Summary";  // no final line break
    auto service = make(&listing);
    ASSERT_TRUE(service);
    const std::pair<const char*, bool> cases[] = {
        {"com.korvane.qvsound.Playback.Start", true},
        {"com.korvane.qvsound.Playback.Start.extra", false},
        {"com.korvane.qvsound.playback.start", false},
        {"com.korvane.telephony.Volume.Start", true},
        {"com.korvane.Volume", false},
        {"com.korvane.qvsound.Setup.Stop", true},
        {"com.korvane.qvsound.Setup.Stoop", false},
        {"com.korvane.telephony.IO.Summary", true},
        {"com.korvane.telephony.Output.Summary", false},
        {"com.korvane.hidden", false},
        {"", false},
    };
    for (const auto& [name, used] : cases) {
        EXPECT_EQ(service->isEventUsed(name), used) << name;
    }
    const std::string onlyComments = "# nothing in use\n\n";
    EXPECT_FALSE(make(&onlyComments)->isEventUsed("com.korvane.qvsound.Playback.Start"));
}

TEST_F(ALinuxAnalyticsService, BuildsThePayloadAtOnceAndOnlyForEventsInUse) {
    const std::string listing = "com.korvane.qvsound.*\n";
    auto service = make(&listing);
    ASSERT_TRUE(service);
    int calls = 0;
    Dictionary source{{"v", 1}};
    const auto producer = [&] {
        ++calls;
        return source;
    };
    service->sendEventLazy("com.korvane.telephony.Playback.Start", producer);
    EXPECT_EQ(calls, 0);
    service->sendEventLazy("com.korvane.qvsound.Playback.Start", producer);
    EXPECT_EQ(calls, 1) << "called before sendEventLazy returns";
    source.set("v", 2);
    service->sendEventLazy("com.korvane.qvsound.Playback.Stop", {});  // no producer: ignored
    service->flush();

    const auto lines = recorded();
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].dump(), fmt::format(R"({{"time":{:.1f},"event":"{}","payload":{{"v":1}}}})",
                                           clock.now(), "com.korvane.qvsound.Playback.Start"));
    EXPECT_EQ(lost, 0);
}

TEST_F(ALinuxAnalyticsService, RefusesAnEventsFileItCannotRead) {
    for (const char* name : {"no-such-file", "adir"}) {  // a directory opens but cannot be read
        fs::create_directories(root / "adir");
        auto created = LinuxAnalyticsService::create((root / "state").string(), clock,
                                                     (root / name).string(), {});
        EXPECT_FALSE(created.service) << name;
        EXPECT_NE(created.error.find(name), std::string::npos) << created.error;
    }
}

}  // namespace
}  // namespace qv
