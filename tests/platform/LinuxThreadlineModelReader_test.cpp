#include "platform/linux/trace/LinuxThreadlineModelReader.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <fstream>
#include <string>
#include <vector>

#include <fmt/format.h>

#include "fakes/TempDirectory.h"

namespace qv {
namespace {

namespace fs = std::filesystem;

// One marker line as the kernel prints it.
std::string marker(std::string_view task, int pid, int cpu, std::string_view stamp,
                   std::string_view text) {
    return fmt::format("{:>16}-{:<7} [{:03}] ...1.  {}: tracing_mark_write: {}\n", task, pid, cpu,
                       stamp, text);
}

Dictionary probe(const std::string& name, const std::string& begin, const std::string& end) {
    return {{"Name", name}, {"BeginMarker", begin}, {"EndMarker", end}};
}

std::vector<std::uint64_t> durations(const ThreadlineProbe& p) {
    std::vector<std::uint64_t> d;
    for (const auto& e : p.events) {
        EXPECT_EQ(e.name, p.name);
        d.push_back(e.duration);
    }
    return d;
}

std::shared_ptr<const ThreadlineModel> model(const std::string& text) {
    auto built = LinuxThreadlineModelReader::modelFromTraceText(text);
    EXPECT_TRUE(built.model) << built.error;
    return built.model;
}

TEST(ALinuxThreadlineModel, PairsMarkersPerTaskNestingInnermostFirstAndCountsTheUnpaired) {
    std::string trace =
        "# qvreportd trace: instance=qvreportd-1-1 template=2 clock=mono buffer_size_kb=8192\n"
        "# tracer: nop\n"
        "#\n"
        "# entries-in-buffer/entries-written: 75/80   #P:2\n"
        "#           TASK-PID     CPU#  |||||  TIMESTAMP  FUNCTION\n"
        "          <idle>-0       [001] d..2.   100.000001: sched_switch: prev_comm=swapper/1 "
        "prev_pid=0 ==> next_comm=a next_pid=10\n";
    // Task 10 nests "decode" in itself; a task name with blanks, dashes and brackets.
    trace += marker("audio worker-1", 10, 0, "100.000010", "qv:decode:begin");
    trace += marker("audio worker-1", 10, 1, "100.000020", "  qv:decode:begin  ");
    trace += marker("audio worker-1", 10, 0, "100.000050", "qv:decode:end");
    // Task 11 interleaves with task 10 on the same probe.
    trace += marker("x [2] y", 11, 1, "100.000060", "qv:decode:begin");
    trace += marker("audio worker-1", 10, 0, "100.000100", "qv:decode:end");
    trace += marker("x [2] y", 11, 1, "100.000160", "qv:decode:end");
    // An end with nothing open, a begin never closed, a begin and an end on two tasks.
    trace += marker("x [2] y", 11, 1, "100.000170", "qv:decode:end");
    trace += marker("late", 12, 0, "100.000200", "qv:decode:begin");
    trace += marker("a", 13, 0, "100.000300", "qv:mix:begin");
    trace += marker("b", 14, 1, "100.000400", "qv:mix:end");
    // "render" overlaps "decode" on task 10; nanosecond stamps are read as they stand.
    trace += marker("audio worker-1", 10, 0, "100.000005000", "qv:render:begin");
    trace += marker("audio worker-1", 10, 0, "100.000500250", "qv:render:end");
    trace += "CPU:1 [LOST 3 EVENTS]\n";
    trace += "broken line: tracing_mark_write: qv:decode:begin\n";
    trace += marker("t", 15, 0, "100.000600", "unrelated text");

    const auto m = model(trace);
    std::vector<std::string> problems;
    const auto probes =
        m->probesFromDictionaries({probe("decode", "qv:decode:begin", "qv:decode:end"),
                                   probe("mix", "qv:mix:begin", "qv:mix:end"),
                                   probe("render", "qv:render:begin", "qv:render:end")},
                                  &problems);
    EXPECT_TRUE(problems.empty());
    ASSERT_EQ(probes.size(), 3u);
    // In the order they began: the outer decode (10..100), the inner (20..50), task 11's.
    EXPECT_EQ(durations(probes[0]), (std::vector<std::uint64_t>{90000, 30000, 100000}));
    EXPECT_NE(probes[0].description.find("events=3 unpairedBegins=1 unmatchedEnds=1"),
              std::string::npos)
        << probes[0].description;
    EXPECT_TRUE(probes[1].events.empty()) << "begin and end on two tasks never pair";
    EXPECT_NE(probes[1].description.find("unpairedBegins=1 unmatchedEnds=1"), std::string::npos);
    EXPECT_EQ(durations(probes[2]), (std::vector<std::uint64_t>{495250}));
    EXPECT_DOUBLE_EQ(m->secondsFromTimebase(1500000), 0.0015);
    EXPECT_NE(m->summary().find("markers=13"), std::string::npos) << m->summary();
    EXPECT_NE(m->summary().find("unreadableMarkerLines=1"), std::string::npos);
    EXPECT_NE(m->summary().find("eventsLostByKernel=8"), std::string::npos);
    EXPECT_NE(m->summary().find("cut=NO"), std::string::npos);
}

TEST(ALinuxThreadlineModel, EvaluatesGroupsAndLeavesOutDictionariesThatDescribeNoProbe) {
    std::string trace;
    trace += marker("t", 1, 0, "5.000000", "a+");
    trace += marker("t", 1, 0, "5.000002", "a-");
    trace += marker("t", 1, 0, "5.000003", "b+");
    trace += marker("t", 1, 0, "5.000007", "b-");
    const auto m = model(trace);
    const Dictionary group{{"Name", "group"},
                           {"Children", Array{Value(probe("a", "a+", "a-")), Value("not a probe"),
                                              Value(probe("b", "b+", "b-"))}}};
    std::vector<std::string> problems;
    const auto probes = m->probesFromDictionaries(
        {group,
         {{"BeginMarker", "a+"}},
         probe("c", "c", "c"),
         {{"Name", "d"}},
         {{"Name", "e"}, {"Children", "x"}},
         probe("never", "n+", "n-"),
         {{"Name", "f"}, {"Children", Array{}}, {"BeginMarker", "b+"}, {"EndMarker", "b-"}}},
        &problems);
    ASSERT_EQ(probes.size(), 3u);
    EXPECT_EQ(probes[0].name, "group");
    EXPECT_TRUE(probes[0].events.empty());
    ASSERT_EQ(probes[0].children.size(), 2u);
    EXPECT_EQ(durations(probes[0].children[0]), std::vector<std::uint64_t>{2000});
    EXPECT_EQ(durations(probes[0].children[1]), std::vector<std::uint64_t>{4000});
    EXPECT_EQ(probes[0].description, "<ThreadlineProbe name=\"group\" children=[a,b]>");
    EXPECT_EQ(probes[1].name, "never");
    EXPECT_TRUE(probes[1].events.empty()) << "markers that never appear give no events";
    EXPECT_EQ(durations(probes[2]), std::vector<std::uint64_t>{4000})
        << "an empty list of children: the probe's own markers count";
    ASSERT_EQ(problems.size(), 5u);
    EXPECT_EQ(problems[0], "probe 0 \"group\" child 1: not a dictionary");
    EXPECT_EQ(problems[1], "probe 1: no \"Name\" string");
    EXPECT_NE(problems[2].find("are the same text"), std::string::npos);
    EXPECT_NE(problems[3].find("needs \"BeginMarker\" and \"EndMarker\""), std::string::npos);
    EXPECT_NE(problems[4].find("\"Children\" is not an array"), std::string::npos);
}

TEST(ALinuxThreadlineModel, ReadsOnlyRegularFilesUpToItsCap) {
    test::TempDirectory dir("qvthreadline");
    LinuxThreadlineModelReader reader;
    EXPECT_FALSE(reader.modelFromTraceFile(dir / "absent").model);
    EXPECT_NE(reader.modelFromTraceFile(dir.path()).error.find("not a regular file"),
              std::string::npos);
    ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);
    EXPECT_FALSE(reader.modelFromTraceFile(dir / "fifo").model) << "refused, not waited on";

    // Lines of one length that cross the reader's chunks, then a cap that leaves half unread.
    std::string trace;
    for (int i = 0; i < 40000; ++i) {
        trace += marker("t", 1, 0, fmt::format("{}.{:06}", 10000 + i, 0), "p+");
        trace += marker("t", 1, 0, fmt::format("{}.{:06}", 10000 + i, 250), "p-");
    }
    std::ofstream(dir / "big.trace") << trace;
    const auto whole = reader.modelFromTraceFile(dir / "big.trace");
    ASSERT_TRUE(whole.model);
    const auto all = whole.model->probesFromDictionaries({probe("p", "p+", "p-")});
    EXPECT_EQ(all[0].events.size(), 40000u);
    EXPECT_EQ(all[0].events.back().duration, 250000u);
    EXPECT_NE(whole.model->summary().find("cut=NO"), std::string::npos);

    LinuxThreadlineModelReader capped(trace.size() / 2);
    const auto half = capped.modelFromTraceFile(dir / "big.trace");
    ASSERT_TRUE(half.model);
    EXPECT_NE(half.model->summary().find("cut=YES"), std::string::npos);
    const auto some = half.model->probesFromDictionaries({probe("p", "p+", "p-")});
    EXPECT_EQ(some[0].events.size(), 20000u);

    // The recorder's own note of a cut.
    const auto noted = model("# qvreportd: trace cut at 100 bytes\n");
    EXPECT_NE(noted->summary().find("cut=YES"), std::string::npos);
}

}  // namespace
}  // namespace qv
