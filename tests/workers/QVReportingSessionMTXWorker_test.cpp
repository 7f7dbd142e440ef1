#include "workers/backends/QVReportingSessionMTXWorker.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <limits>
#include <string>
#include <vector>

#include "fakes/FakePlatform.h"
#include "fakes/MemoryLogSink.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingWorkerRegistry.h"
#include "workers/backends/mtx/AudioIssueDetected.h"

namespace qv {
namespace {

using namespace std::string_literals;
using mtxmetrics::AudioIssueDetected;

class AnMTXWorker : public ::testing::Test {
  protected:
    void SetUp() override {
        QVReportingWorkerRegistry::TEST_reset({&makeWorkerClass<QVReportingSessionMTXWorker>()});
    }
    void TearDown() override { QVReportingWorkerRegistry::TEST_reset({}); }

    std::shared_ptr<QVReportingSession> make(ReporterID id = 7) {
        return QVReportingSession::initWithID(fake.platform, id, {1234});
    }
    static std::shared_ptr<QVReportingSessionMessage> message(
        Dictionary payload, AudioEventType t = type::kIssueDetector,
        AudioEventCategory c = category::kIO) {
        return std::make_shared<QVReportingSessionMessage>(std::move(payload), c, t);
    }
    // The one record posted since the last call, read back from its wire bytes.
    AudioIssueDetected posted() {
        const auto all = fake.mtx.posted();
        fake.mtx.clear();
        EXPECT_EQ(all.size(), 1u);
        AudioIssueDetected record;
        if (all.size() == 1) {
            EXPECT_EQ(all[0].metricID, 0x5B0003u);
            mtxmetrics::Reader reader(all[0].wire);
            EXPECT_TRUE(record.readFrom(reader));
        }
        return record;
    }

    test::FakePlatform fake;
};

TEST_F(AnMTXWorker, PostsOneRecordPerIssueDetectorMessageOfAnyCategory) {
    auto session = make();
    session->setIsSingleMessageSession(true);  // it serves those too
    session->start();
    session->sendMessage(message({{"issue_type", "dropout"},
                                  {"node", 12},
                                  {"rtaid_client", "com.example.player"},
                                  {"any_channel_silence_seconds", 5}},
                                 type::kIssueDetector, category::kPrefixHAL | category::kOutput));
    const auto all = fake.mtx.posted();
    ASSERT_EQ(all.size(), 1u);
    EXPECT_EQ(all[0].metricID, 5963779u);
    EXPECT_EQ(all[0].wire,
              "\x10\x05\x1a\x07"
              "dropout\x22\x02"
              "12\x2a\x12"
              "com.example.player"s)
        << "fields 2 to 5 in order, no field 1";
    fake.mtx.clear();

    // Any other type posts nothing, whatever its category and keys.
    for (AudioEventType t : {type::kGeneric, type::kStart, type::kEnergyLog, AudioEventType{6},
                             AudioEventType{0xFFFF}}) {
        for (AudioEventCategory c : {category::kIO, category::kError, category::kUnknown}) {
            session->sendMessage(message({{"issue_type", "x"}, {"t", t}}, t, c));
        }
    }
    EXPECT_TRUE(fake.mtx.posted().empty());
}

TEST_F(AnMTXWorker, LogsEachMissingKeyInOrderAndPostsWhatItFound) {
    test::ScopedMemoryLog log;
    auto worker = QVReportingSessionMTXWorker::initWithSession(make());
    ASSERT_TRUE(worker);
    worker->handleMessage(message({}));
    EXPECT_EQ(posted(), AudioIssueDetected{});
    std::vector<std::string> lines;
    for (const auto& line : log->lines()) {
        if (line.category == "qvra") {
            EXPECT_EQ(line.level, LogLevel::Error);
            // After "%25s:%-5d ": the file name, a colon, the line number in 5 columns, a blank.
            lines.push_back(line.text.substr(line.text.find(".cpp:") + 5 + 6));
        }
    }
    EXPECT_EQ(lines, (std::vector<std::string>{
                         "Failed to get issue_type for AudioIssueDetected",
                         "Failed to get rtaid_client for AudioIssueDetected",
                         "Failed to get node for AudioIssueDetected",
                         "Failed to get any_channel_silence_seconds for AudioIssueDetected"}));

    // A null value counts as missing; the other fields still go out. A null message or a worker
    // whose session is gone does not crash.
    log->clear();
    worker->handleMessage(message({{"issue_type", "x"}, {"node", nullptr}}));
    const auto record = posted();
    EXPECT_EQ(record.issuetype, "x");
    EXPECT_EQ(record.node, "");
    EXPECT_TRUE(log->contains("Failed to get node for AudioIssueDetected"));
    EXPECT_FALSE(log->contains("Failed to get issue_type"));
    worker->handleMessage(nullptr);
    EXPECT_TRUE(fake.mtx.posted().empty());
}

TEST_F(AnMTXWorker, StoresTheTextOfAnyValueInTheStringFields) {
    struct Case {
        Value value;
        std::string bytes;
    };
    const std::vector<Case> cases = {
        {"stall", "stall"},
        {"", ""},
        {12, "12"},
        {-3, "-3"},
        {std::numeric_limits<std::uint64_t>::max(), "18446744073709551615"},
        {2.5, "2.5"},
        {5.0, "5"},
        {std::nan(""), "nan"},
        {true, "1"},
        {Date{0}, "1970-01-01 00:00:00 +0000"},
        {Array{1, "a b"}, "(\n    1,\n    \"a b\"\n)"},
        {Dictionary{{"k", Array{}}}, "{\n    k = (\n    );\n}"},
        {Bytes{0xde, 0xad}, "{length = 2, bytes = 0xdead}"},
        {"ab\0cd"s, "ab"},  // a NUL-terminated string ends at its first NUL
        {"caf\xc3\xa9", "caf\xc3\xa9"},
        {"bad \xff utf-8", ""},  // no byte-string form: stored empty
    };
    auto worker = QVReportingSessionMTXWorker::initWithSession(make());
    for (const auto& c : cases) {
        worker->handleMessage(
            message({{"issue_type", c.value}, {"rtaid_client", c.value}, {"node", c.value}}));
        const auto record = posted();
        EXPECT_EQ(record.issuetype, c.bytes) << c.value.description();
        EXPECT_EQ(record.rtaidclient, c.bytes) << c.value.description();
        EXPECT_EQ(record.node, c.bytes) << c.value.description();
    }
}

TEST_F(AnMTXWorker, TakesTheDurationAsTheValuesIntegerValueCutTo32Bits) {
    struct Case {
        Value value;
        std::int32_t duration;
    };
    const double inf = std::numeric_limits<double>::infinity();
    const std::vector<Case> cases = {
        {5, 5},
        {-1, -1},
        {std::int64_t{4294967301}, 5},
        {std::int64_t{2147483648}, std::numeric_limits<std::int32_t>::min()},
        {std::numeric_limits<std::uint64_t>::max(), -1},
        {std::uint64_t{4294967303}, 7},
        {5.9, 5},
        {-5.9, -5},
        {4294967301.5, 5},
        {std::nan(""), 0},
        {inf, -1},  // saturates at INT64_MAX, whose low 32 bits are all ones
        {-inf, 0},  // INT64_MIN
        {1e300, -1},
        {true, 1},
        {false, 0},
        {"42s", 42},
        {"  -3.9", -3},
        {"+7", 7},
        {"4294967297", 1},
        {"99999999999999999999", -1},
        {"-99999999999999999999", 0},
        {"-9223372036854775808", 0},
        {"abc", 0},
        {"", 0},
        {"- 1", 0},
        {"0x10", 0},
        {Date{1000}, 0},
        {Bytes{1}, 0},
        {Array{5}, 0},
        {Dictionary{{"a", 5}}, 0},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(QVReportingSessionMTXWorker::durationFromValue(c.value), c.duration)
            << c.value.description();
    }

    // Through the worker: a negative duration goes out as a ten-byte varint.
    auto worker = QVReportingSessionMTXWorker::initWithSession(make());
    worker->handleMessage(message({{"any_channel_silence_seconds", -2.5}}));
    const auto wire = fake.mtx.posted().at(0).wire;
    EXPECT_EQ(wire.substr(0, 11), "\x10\xfe\xff\xff\xff\xff\xff\xff\xff\xff\x01"s);
    EXPECT_EQ(posted().duration, -2);
}

}  // namespace
}  // namespace qv
