#include "platform/linux/sinks/LinuxAnalyticsService.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <string>

#include <fmt/format.h>

#include "fakes/FakeClock.h"
#include "fakes/TempDirectory.h"

namespace qv {
namespace {

class ALinuxAnalyticsService : public ::testing::Test {
  protected:
    // A service whose events file holds listing ("" for none).
    std::unique_ptr<LinuxAnalyticsService> make(const std::string& listing) {
        const std::string file = listing.empty() ? "" : (tmp / "events.txt").string();
        if (!file.empty()) {
            std::ofstream(file, std::ios::binary) << listing;
        }
        auto created = LinuxAnalyticsService::create((tmp / "state").string(), clock, file, {});
        EXPECT_TRUE(created.error.empty()) << created.error;
        return std::move(created.service);
    }

    test::TempDirectory tmp{"qvanalytics"};
    test::FakeClock clock;
};

TEST_F(ALinuxAnalyticsService, UsesEveryEventWithoutAFileAndOnlyTheNamesAndGlobsItLists) {
    EXPECT_FALSE(make("# nothing in use\n\n")->isEventUsed("com.korvane.qvsound.Playback.Start"));
    auto service = make(
        "# events the pipeline consumes\n\n   \t\n  com.korvane.qvsound.Playback.Start  \r\n"
        "com.korvane.*.Volume.*\n#com.korvane.hidden\ncom.korvane.qvsound.Setup.St?p\n"
        "com.korvane.telephony.[!O]*.Summary");  // no final line break
    const std::pair<const char*, bool> cases[] = {{"com.korvane.qvsound.Playback.Start", true},
                                                  {"com.korvane.qvsound.playback.start", false},
                                                  {"com.korvane.qvsound.Playback.Start.x", false},
                                                  {"com.korvane.telephony.Volume.Start", true},
                                                  {"com.korvane.Volume", false},
                                                  {"com.korvane.qvsound.Setup.Stop", true},
                                                  {"com.korvane.qvsound.Setup.Stoop", false},
                                                  {"com.korvane.telephony.IO.Summary", true},
                                                  {"com.korvane.telephony.Output.Summary", false},
                                                  {"com.korvane.hidden", false}};
    for (const auto& [name, used] : cases) {
        EXPECT_EQ(service->isEventUsed(name), used) << name;
    }
}

TEST_F(ALinuxAnalyticsService, BuildsThePayloadAtOnceOnlyForEventsInUseAndRefusesAnUnreadableFile) {
    auto service = make("com.korvane.qvsound.*\n");
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
    std::ifstream in(tmp / "state/sinks/analytics.jsonl");
    const std::string text(std::istreambuf_iterator<char>(in), {});
    EXPECT_EQ(text, fmt::format(R"({{"time":{:.1f},"seq":1,"event":"{}","payload":{{"v":1}}}})"
                                "\n",
                                clock.now(), "com.korvane.qvsound.Playback.Start"));

    std::filesystem::create_directories(tmp / "adir");
    for (const char* name : {"no-such-file", "adir"}) {  // a directory opens but cannot be read
        auto created = LinuxAnalyticsService::create((tmp / "state").string(), clock,
                                                     (tmp / name).string(), {});
        EXPECT_FALSE(created.service) << name;
        EXPECT_NE(created.error.find(name), std::string::npos) << created.error;
    }
}

}  // namespace
}  // namespace qv
