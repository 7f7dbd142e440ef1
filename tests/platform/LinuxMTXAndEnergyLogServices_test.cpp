#include <gtest/gtest.h>

#include <string>

#include <nlohmann/json.hpp>

#include "fakes/FakeClock.h"
#include "fakes/SinkLines.h"
#include "fakes/TempDirectory.h"
#include "platform/linux/sinks/LinuxEnergyLogService.h"
#include "platform/linux/sinks/LinuxMTXMetricsService.h"

namespace qv {
namespace {

using Json = nlohmann::ordered_json;

class Wire final : public MTXMetricRecord {
  public:
    explicit Wire(std::string bytes) : bytes_(std::move(bytes)) {}
    void appendWireBytes(std::string& out) const override { out += bytes_; }

  private:
    std::string bytes_;
};

// The daemon's end-to-end test reads both sinks in full; this checks what it cannot reach: a
// record that is gone right after the call, and the energy log's optional argument.
TEST(TheLinuxMTXAndEnergyLogServices, CopyWhatTheyAreGivenBeforeTheCallReturns) {
    test::TempDirectory tmp{"qvmtx"};
    test::FakeClock clock;
    const std::string state = (tmp.path() / "state").string();
    LinuxMTXMetricsService mtx(std::make_unique<JsonlSink>(state, "mtx", clock, SinkCallbacks{}));
    LinuxEnergyLogService energyLog(
        std::make_unique<JsonlSink>(state, "energylog", clock, SinkCallbacks{}));
    {
        auto record = std::make_unique<Wire>(std::string("\x10\x01\x1a\x00", 4));
        mtx.postMetric(5963779, *record);
    }
    {
        const Dictionary payload{{"z", 1}, {"a", Array{"x"}}};
        const Dictionary options{{"o", true}};
        energyLog.logRegisteredEvent(28, "LeakedHapticsSessionInfo", payload, &options);
    }
    mtx.flush();
    energyLog.flush();
    const auto records = test::readSinkLines(state + "/sinks/mtx.jsonl");
    ASSERT_EQ(records.size(), 1u);
    EXPECT_EQ(records[0].dump(),
              R"({"time":1706707501.0,"seq":1,"metric":5963779,"record":"EAEaAA=="})");
    const auto events = test::readSinkLines(state + "/sinks/energylog.jsonl");
    ASSERT_EQ(events.size(), 1u);
    EXPECT_EQ(events[0].dump(),
              R"({"time":1706707501.0,"seq":1,"registry":28,"event":"LeakedHapticsSessionInfo",)"
              R"("payload":{"z":1,"a":["x"]},"options":{"o":true}})");
}

}  // namespace
}  // namespace qv
