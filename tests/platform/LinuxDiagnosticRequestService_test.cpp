#include "platform/linux/capture/LinuxDiagnosticRequestService.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>
#include <nlohmann/json.hpp>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "fakes/Notes.h"
#include "fakes/SinkLines.h"
#include "fakes/TempDirectory.h"
#include "fakes/WaitUntil.h"
#include "platform/linux/capture/LinuxConfinedProcess.h"
#include "platform/linux/system/LinuxClock.h"

namespace qv {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using Json = nlohmann::ordered_json;

constexpr DiagnosticRequestOptions kSpinlog{true, true, false, false, false};

std::string readFile(const fs::path& path) {
    std::ifstream in(path);
    return std::string((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
}

// Whether the process is gone (or only a zombie waiting for its parent).
bool processGone(pid_t pid) {
    std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
    std::string text;
    if (!std::getline(stat, text)) {
        return true;
    }
    const auto close = text.rfind(')');
    return close != std::string::npos && close + 2 < text.size() && text[close + 2] == 'Z';
}

class TheLinuxDiagnosticRequestService : public ::testing::Test {
  protected:
    LinuxDiagnosticRequestService::Options options(const std::string& perf) {
        LinuxDiagnosticRequestService::Options o;
        o.spinlogsDirectory = spinlogs;
        o.perf = perf;
        o.notice = notices.callback();
        return o;
    }
    std::unique_ptr<LinuxDiagnosticRequestService> make(LinuxDiagnosticRequestService::Options o) {
        return std::make_unique<LinuxDiagnosticRequestService>(
            clock,
            std::make_unique<JsonlSink>(state.path().string(),
                                        std::string(LinuxDiagnosticRequestService::kSinkName),
                                        clock, SinkCallbacks{}),
            std::move(o));
    }
    // A stand-in for perf: a shell script, given the body of its "record" and "report" cases.
    std::string fakePerf(const std::string& record, const std::string& report = "echo report") {
        const fs::path path = tools.path() / ("perf" + std::to_string(++scripts));
        std::ofstream(path) << "#!/bin/sh\n"
                               "mode=$1\n"
                               "for a in \"$@\"; do [ \"$prev\" = -o ] && out=$a; "
                               "[ \"$prev\" = -i ] && in=$a; prev=$a; done\n"
                               "case $mode in\n"
                               "record)\n"
                            << record
                            << "\n;;\n"
                               "report)\n"
                            << report << "\n;;\nesac\n";
        fs::permissions(path, fs::perms::owner_all | fs::perms::group_read | fs::perms::group_exec |
                                  fs::perms::others_read | fs::perms::others_exec);
        return path.string();
    }
    void request(LinuxDiagnosticRequestService& service, int n,
                 const DiagnosticRequestOptions& o = kSpinlog) {
        service.request("com.korvane.qvsound", "AudioOverloads", "com.example.daw",
                        Dictionary{{"smallest_buffer_frame_size", 1024}, {"n", n}}, o);
    }
    std::vector<nlohmann::ordered_json> lines(const std::string& op) const {
        return test::readSinkLines(state / "sinks/diagnostics.jsonl", op);
    }

    test::TempDirectory state{"qv-diagnostics"};
    test::TempDirectory tools{"qv-fakeperf"};
    fs::path spinlogs = state / "logs/Audio/Spinlogs";
    LinuxClock clock;
    int scripts = 0;
    test::Notes notices;
};

TEST_F(TheLinuxDiagnosticRequestService, RecordsRequestsAndSaysOnceThatPerfIsMissingOrRefused) {
    auto service = make(options((tools / "no-such-perf").string()));
    request(*service, 1);
    service->flush();
    request(*service, 2);
    request(*service, 3, {false, false, false, false, false});
    service->flush();

    auto requests = lines("request");
    ASSERT_EQ(requests.size(), 3u);
    // The request's members are the end-to-end overload test's; here, its number and that it
    // was taken to be sampled before the sampler looked for perf.
    EXPECT_EQ(requests[0]["request"], 1);
    EXPECT_EQ(requests[0]["sampled"], true) << "perf is looked for by the sampler, not the caller";
    auto samples = lines("sample");
    ASSERT_EQ(samples.size(), 1u);
    EXPECT_EQ(samples[0]["ok"], false);
    EXPECT_EQ(samples[0]["error"].get<std::string>().rfind("perf is not installed", 0), 0u);
    EXPECT_EQ(requests[1]["sampled"], false);
    EXPECT_EQ(requests[1]["reason"], samples[0]["error"]);
    EXPECT_EQ(requests[2]["reason"], "no stack sample was asked for");
    EXPECT_EQ(notices.lines().size(), 1u);
    const auto c = service->counters();
    EXPECT_EQ(std::tie(c.sampled, c.notSampledUnavailable, c.notSampledNotAsked),
              std::tuple(0u, 2u, 1u));
    EXPECT_FALSE(fs::exists(spinlogs)) << "nothing is made for a sample that cannot be taken";

    // perf that refuses at run time: the same, with its own words.
    service = make(options(fakePerf(
        "echo 'Error: Access to performance monitoring and observability operations is limited.' "
        ">&2\necho 'Consider tweaking /proc/sys/kernel/perf_event_paranoid' >&2\nexit 255")));
    request(*service, 4);
    service->flush();
    request(*service, 5);
    service->flush();
    samples = lines("sample");
    ASSERT_EQ(samples.size(), 2u);
    const std::string error = samples[1]["error"];
    EXPECT_EQ(error.rfind("perf record exited with status 255: ", 0), 0u) << error;
    EXPECT_NE(error.find("perf_event_paranoid"), std::string::npos) << error;
    requests = lines("request");
    EXPECT_EQ(requests.back()["reason"], "perf refused: " + error);
    EXPECT_EQ(notices.lines().size(), 2u);
}

TEST_F(TheLinuxDiagnosticRequestService, SamplesOneAtATimeAndRecordsTheRestWithoutQueueing) {
    // record waits until the test lets it go, holding the sampler busy meanwhile.
    const fs::path release = tools / "release";
    auto o = options(fakePerf(
        "while [ ! -e " + release.string() + " ]; do sleep 0.01; done\necho \"$@\" > \"$out\"",
        "echo \"report of $in\""));
    auto service = make(std::move(o));
    for (int i = 1; i <= 200; ++i) {
        request(*service, i);
    }
    std::ofstream(release) << "go";
    service->flush();
    request(*service, 201, {true, false, true, true, true});
    service->flush();

    const auto requests = lines("request");
    ASSERT_EQ(requests.size(), 201u);
    EXPECT_EQ(requests[0]["sampled"], true);
    EXPECT_EQ(requests[200]["sampled"], true) << "free again once the first is done";
    const auto samples = lines("sample");
    ASSERT_EQ(samples.size(), 2u);
    EXPECT_EQ(samples[0]["request"], 1);
    EXPECT_EQ(samples[0]["ok"], true);
    EXPECT_EQ(samples[0]["seconds"], 3.0);
    const fs::path data = samples[0]["data"].get<std::string>();
    EXPECT_EQ(data.parent_path(), spinlogs);
    EXPECT_EQ(readFile(data), "record -a -g --no-buildid-cache --max-size=65536K -o " +
                                  data.string() + " -- sleep 3.000\n");
    EXPECT_EQ(readFile(samples[0]["report"].get<std::string>()),
              "report of " + data.string() + "\n");
    EXPECT_EQ(samples[0]["reportTruncated"], false);
    // The other options: no call graphs, the longer window, user space only, no report.
    const fs::path second = samples[1]["data"].get<std::string>();
    EXPECT_EQ(readFile(second), "record -a --all-user --no-buildid-cache --max-size=65536K -o " +
                                    second.string() + " -- sleep 10.000\n");
    EXPECT_FALSE(samples[1].contains("report"));

    const auto c = service->counters();
    EXPECT_EQ(std::tie(c.requests, c.sampled, c.notSampledBusy), std::tuple(201u, 2u, 199u));
}

TEST_F(TheLinuxDiagnosticRequestService, ConfinesPerfAndBoundsItsTimeAndOutput) {
    // A descriptor the daemon left inheritable must not reach perf (numbered high, where the
    // child's own descriptors do not land).
    const int opened = ::open((tools / "leak-me").c_str(), O_WRONLY | O_CREAT, 0600);
    ASSERT_GE(opened, 0);
    const int leaked = ::fcntl(opened, F_DUPFD, 100);
    ::close(opened);
    ASSERT_GE(leaked, 100);
    const fs::path outside = state / "outside";
    auto o =
        options(fakePerf("echo data > \"$out\"\n"
                         "echo x > " +
                             outside.string() +
                             " 2>/dev/null\n"
                             "echo x > inside",
                         "ls -l /proc/self/fd\necho HOME=$HOME TMPDIR=$TMPDIR PWD=$(pwd)\n"
                         "head -c 100000 /dev/zero | tr '\\0' x"));
    o.maxReportBytes = 4096;
    o.maxKeptSpinlogs = 2;
    auto service = make(std::move(o));
    for (int i = 1; i <= 3; ++i) {
        request(*service, i);
        service->flush();
    }
    ::close(leaked);

    const auto samples = lines("sample");
    ASSERT_EQ(samples.size(), 3u);
    const Json& last = samples[2];
    EXPECT_EQ(last["ok"], true) << last.dump();
    const std::string report = readFile(last["report"].get<std::string>());
    EXPECT_EQ(report.size(), 4096u);
    EXPECT_EQ(last["reportBytes"], 4096);
    EXPECT_EQ(last["reportTruncated"], true);
    EXPECT_EQ(report.find("leak-me"), std::string::npos) << report.substr(0, 800);
    EXPECT_EQ(report.find("diagnostics.jsonl"), std::string::npos) << "nor the sink's file";
    EXPECT_NE(report.find("HOME=" + spinlogs.string() + " TMPDIR=" + spinlogs.string() +
                          " PWD=" + spinlogs.string()),
              std::string::npos);
    EXPECT_TRUE(fs::exists(spinlogs / "inside"));
    if (!QVReportingConfinementUnavailableReason()) {
        EXPECT_FALSE(fs::exists(outside)) << "writes outside the Spinlogs directory are refused";
    }

    // Only the newest two groups of files are kept.
    std::vector<std::string> names;
    for (const auto& e : fs::directory_iterator(spinlogs)) {
        if (e.path().filename() != "inside") {
            names.push_back(e.path().filename().string());
        }
    }
    std::sort(names.begin(), names.end());
    ASSERT_EQ(names.size(), 6u) << "two groups of three files";
    for (std::size_t i = 0; i < names.size(); ++i) {
        EXPECT_NE(names[i].find(i < 3 ? "-000002." : "-000003."), std::string::npos) << names[i];
    }
}

TEST_F(TheLinuxDiagnosticRequestService, StopsAPerfThatOverstaysWithEverythingItStarted) {
    // Written where perf may write: its working directory.
    const fs::path pidFile = spinlogs / "child.pid";
    auto o = options(
        fakePerf("trap '' INT\nsleep 1000 &\necho $! > " + pidFile.string() + "\nwait\nwait"));
    // The window leaves the shell time to ignore SIGINT before it comes, on a busy machine too.
    o.sampleWindow = 2000ms;
    o.recordGrace = 100ms;
    o.killGrace = 100ms;
    auto service = make(std::move(o));
    request(*service, 1);
    service->flush();
    const auto samples = lines("sample");
    ASSERT_EQ(samples.size(), 1u);
    EXPECT_EQ(samples[0]["ok"], false);
    EXPECT_EQ(samples[0]["error"], "perf record did not finish within 2100 ms and was stopped");
    const pid_t child = std::stoi(readFile(pidFile));
    EXPECT_TRUE(test::waitUntil([&] { return processGone(child); }))
        << "what perf started goes with it";
    EXPECT_EQ(service->counters().samplesFailed, 1u);

    // A sampler still running when the service goes is killed, and says so.
    const fs::path started = spinlogs / "started";
    auto hanging = make(options(fakePerf("touch started\nexec sleep 1000")));
    request(*hanging, 2);
    ASSERT_TRUE(test::waitUntil([&] { return fs::exists(started); }));
    hanging.reset();
    const auto stopped = lines("sample");
    ASSERT_EQ(stopped.size(), 2u);
    EXPECT_EQ(stopped[1]["error"], "perf record was stopped: the service is stopping");
}

}  // namespace
}  // namespace qv
