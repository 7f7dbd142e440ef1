#include <gtest/gtest.h>

#include <fstream>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "fakes/FakeClock.h"
#include "fakes/TempDirectory.h"
#include "platform/linux/LinuxEnergyLogService.h"
#include "platform/linux/LinuxMTXMetricsService.h"
#include "values/Base64.h"

namespace qv {
namespace {

using namespace std::string_literals;
using Json = nlohmann::ordered_json;

class Wire final : public MTXMetricRecord {
  public:
    explicit Wire(std::string bytes) : bytes_(std::move(bytes)) {}
    void appendWireBytes(std::string& out) const override { out += bytes_; }

  private:
    std::string bytes_;
};

std::vector<Json> linesOf(const std::string& path) {
    std::vector<Json> lines;
    std::ifstream in(path);
    for (std::string line; std::getline(in, line);) {
        lines.push_back(Json::parse(line));
    }
    return lines;
}

std::vector<std::string> keysOf(const Json& object) {
    std::vector<std::string> keys;
    for (const auto& [key, value] : object.items()) {
        keys.push_back(key);
    }
    return keys;
}

TEST(TheLinuxMTXAndEnergyLogServices, WriteOneSinkLineEachWithTheRecordAsBase64OfItsWireBytes) {
    test::TempDirectory tmp{"qvmtx"};
    test::FakeClock clock;
    const std::string state = (tmp.path() / "state").string();
    LinuxMTXMetricsService mtx(std::make_unique<JsonlSink>(state, "mtx", clock, SinkCallbacks{}));
    LinuxEnergyLogService energyLog(
        std::make_unique<JsonlSink>(state, "energylog", clock, SinkCallbacks{}));

    const std::string wire = "\x10\xff\xff\xff\xff\xff\xff\xff\xff\xff\x01\x1a\x00\x22\x01\x00"s;
    {
        Wire record(wire);
        mtx.postMetric(5963779, record);
    }  // the record goes right after the call; the line is already the service's
    mtx.postMetric(1, Wire(""));
    const Dictionary payload{{"z", 1}, {"a", Array{"x"}}, {"big", 18446744073709551615u}};
    energyLog.logRegisteredEvent(28, "Vantrel_Haptics_ClientStatus", payload, nullptr);
    const Dictionary options{{"o", true}};
    energyLog.logRegisteredEvent(28, "LeakedHapticsSessionInfo", {}, &options);
    mtx.flush();
    energyLog.flush();

    const auto records = linesOf(state + "/sinks/mtx.jsonl");
    ASSERT_EQ(records.size(), 2u);
    EXPECT_EQ(keysOf(records[0]), (std::vector<std::string>{"time", "metric", "record"}));
    EXPECT_EQ(records[0]["time"].get<double>(), clock.now());
    EXPECT_EQ(records[0]["metric"], 5963779);
    const auto bytes = QVReportingBase64Decode(records[0]["record"].get<std::string>());
    ASSERT_TRUE(bytes);
    EXPECT_EQ(std::string(bytes->begin(), bytes->end()), wire);
    EXPECT_EQ(records[1]["record"], "");

    const auto events = linesOf(state + "/sinks/energylog.jsonl");
    ASSERT_EQ(events.size(), 2u);
    EXPECT_EQ(keysOf(events[0]),
              (std::vector<std::string>{"time", "registry", "event", "payload"}));
    EXPECT_EQ(events[0]["registry"], 28);
    EXPECT_EQ(events[0]["event"], "Vantrel_Haptics_ClientStatus");
    EXPECT_EQ(events[0]["payload"].dump(), R"({"z":1,"a":["x"],"big":18446744073709551615})");
    EXPECT_EQ(keysOf(events[1]),
              (std::vector<std::string>{"time", "registry", "event", "payload", "options"}));
    EXPECT_EQ(events[1]["options"], Json({{"o", true}}));
}

}  // namespace
}  // namespace qv
