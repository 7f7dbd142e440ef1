#include "workers/backends/QVReportingSessionMTXWorker.h"

#include <cmath>
#include <cstdint>
#include <limits>

#include "workers/WorkerTestSupport.h"
#include "workers/backends/mtx/AudioIssueDetected.h"

namespace qv {
namespace {

using namespace std::string_literals;
using mtxmetrics::AudioIssueDetected;

class AnMTXWorker : public ::testing::Test {
  protected:
    void SetUp() override {
        session = QVReportingSession::initWithID(fake.platform, 7, {1234});
        worker = QVReportingSessionMTXWorker::initWithSession(session);
    }

    // The one record posted since the last call, read back from its wire bytes.
    AudioIssueDetected posted() {
        const auto all = fake.mtx.posted();
        fake.mtx.clear();
        AudioIssueDetected record;
        EXPECT_EQ(all.size(), 1u);
        if (all.size() == 1) {
            mtxmetrics::Reader reader(all[0].wire);
            EXPECT_TRUE(record.readFrom(reader));
        }
        return record;
    }

    test::ScopedWorkerClasses<QVReportingSessionMTXWorker> workerClasses;
    test::FakePlatform fake;
    std::shared_ptr<QVReportingSession> session;
    std::shared_ptr<QVReportingSessionMTXWorker> worker;
};

// Which messages make records, and a record as protoc reads it: the MTX sink's end-to-end test.
TEST_F(AnMTXWorker, StoresTheTextOfAnyValueAndTheIntegerValueCutTo32Bits) {
    worker->handleMessage(nullptr);
    EXPECT_TRUE(fake.mtx.posted().empty());
    const std::vector<std::pair<Value, std::string>> texts = {
        {12, "12"},
        {std::numeric_limits<std::uint64_t>::max(), "18446744073709551615"},
        {2.5, "2.5"},
        {std::nan(""), "nan"},
        {true, "1"},
        {Date{0}, "1970-01-01 00:00:00 +0000"},
        {Array{1, "a b"}, "(\n    1,\n    \"a b\"\n)"},
        {Dictionary{{"k", 1}}, "{\n    k = 1;\n}"},
        {"ab\0cd"s, "ab"},       // a NUL-terminated string ends at its first NUL
        {"bad \xff utf-8", ""},  // no byte-string form: stored empty
    };
    for (const auto& [value, text] : texts) {
        worker->handleMessage(
            test::message({{"issue_type", value}, {"rtaid_client", value}, {"node", value}},
                          category::kIO, type::kIssueDetector));
        const auto record = posted();
        EXPECT_EQ(record.issuetype, text) << value.description();
        EXPECT_EQ(record.rtaidclient, text) << value.description();
        EXPECT_EQ(record.node, text) << value.description();
    }

    const double inf = std::numeric_limits<double>::infinity();
    const std::vector<std::pair<Value, std::int32_t>> durations = {
        {-1, -1},
        {std::int64_t{4294967301}, 5},
        {std::int64_t{2147483648}, std::numeric_limits<std::int32_t>::min()},
        {std::uint64_t{4294967303}, 7},
        {std::numeric_limits<std::uint64_t>::max(), -1},
        {-5.9, -5},
        {std::nan(""), 0},
        {inf, -1},  // saturates at INT64_MAX, whose low 32 bits are all ones
        {-inf, 0},  // INT64_MIN
        {true, 1},
        {"  -3.9s", -3},
        {"+4294967297", 1},
        {"99999999999999999999", -1},
        {"-99999999999999999999", 0},
        {"abc", 0},
        {"- 1", 0},
        {Date{1000}, 0},
        {Array{5}, 0},
        {Dictionary{{"a", 5}}, 0},
    };
    for (const auto& [value, duration] : durations) {
        EXPECT_EQ(QVReportingSessionMTXWorker::durationFromValue(value), duration)
            << value.description();
    }
}

}  // namespace
}  // namespace qv
