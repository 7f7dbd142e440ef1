#include "platform/linux/trace/LinuxSpanTraceRecorder.h"

#include <gtest/gtest.h>
#include <sys/mount.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <fmt/format.h>

#include "fakes/Notes.h"
#include "fakes/TempDirectory.h"

namespace qv {
namespace {

namespace fs = std::filesystem;

// A tracefs mounted on a directory of the test's own, so that the test neither needs nor
// disturbs the system's mount; unmounted again at the end.
class PrivateTracefs {
  public:
    PrivateTracefs() {
        if (::mount("nodev", dir_.path().c_str(), "tracefs", 0, nullptr) == 0) {
            mounted_ = true;
        } else {
            reason_ = fmt::format("cannot mount tracefs ({}): needs root and tracefs",
                                  std::strerror(errno));
        }
    }
    ~PrivateTracefs() {
        if (mounted_) {
            ::umount2(dir_.path().c_str(), MNT_DETACH);
        }
    }
    bool mounted() const { return mounted_; }
    const std::string& reason() const { return reason_; }
    const fs::path& root() const { return dir_.path(); }

  private:
    test::TempDirectory dir_{"qvtracefs"};
    bool mounted_ = false;
    std::string reason_;
};

class Delegate : public SpanTraceDelegate {
  public:
    void spanTraceDidStart(const std::optional<std::string>& error) override {
        note("start:" + error.value_or("ok"));
    }
    void spanTraceDidStop(const std::optional<std::string>& error) override {
        note("stop:" + error.value_or("ok"));
    }
    void spanTraceDidComplete(const std::optional<fs::path>& location, const std::string& token,
                              const std::optional<std::string>& error) override {
        std::lock_guard lock(mutex_);
        this->location = location;
        this->token = token;
        calls.push_back("complete:" + error.value_or("ok"));
    }
    std::vector<std::string> calls;
    std::optional<fs::path> location;
    std::string token;
    std::thread::id thread;

  private:
    void note(std::string call) {
        std::lock_guard lock(mutex_);
        thread = std::this_thread::get_id();
        calls.push_back(std::move(call));
    }
    std::mutex mutex_;
};

std::string readAll(const fs::path& path) {
    std::ifstream in(path);
    return std::string((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
}

void writeMarker(const fs::path& traceMarker, const std::string& text) {
    std::ofstream out(traceMarker);
    out << text << '\n';
}

// A process number that no process has now.
long unusedPid() {
    for (long pid = 4194000; pid > 1000; --pid) {
        if (!fs::exists(fmt::format("/proc/{}", pid))) {
            return pid;
        }
    }
    return 0;
}

std::vector<std::string> ourInstances(const fs::path& root) {
    std::vector<std::string> names;
    const std::string prefix = fmt::format("qvreportd-{}-", ::getpid());
    for (const auto& entry : fs::directory_iterator(root / "instances")) {
        const std::string name = entry.path().filename().string();
        if (name.starts_with(prefix)) {
            names.push_back(name);
        }
    }
    return names;
}

// What a failed start says and that its completion follows at once are the end-to-end
// TraceWithoutTracefs test's; here, the thread they come on, and the templates.
TEST(ALinuxSpanTraceRecorder, ReportsAFailedStartOnItsOwnThreadWhereThereIsNoTracefs) {
    test::TempDirectory dir("qvrecorder");
    LinuxSpanTraceRecorder::Options options;
    options.traceDirectory = dir / "raw";
    options.tracefsRoot = dir.path();  // a directory, not a tracefs
    LinuxSpanTraceRecorder recorder(options, [](const std::string&) {});
    auto delegate = std::make_shared<Delegate>();
    auto session = recorder.createSession(*recorder.configurationFromTemplate(3));
    session->setDelegate(delegate);
    session->start();
    recorder.drain();
    EXPECT_NE(delegate->thread, std::this_thread::get_id()) << "callbacks come on its thread";
    EXPECT_FALSE(session->isValid());

    const auto two = LinuxSpanTraceRecorder::templateEvents(2);
    const auto three = LinuxSpanTraceRecorder::templateEvents(3);
    EXPECT_EQ(std::vector<std::string>(three.begin(), three.begin() + two.size()), two);
    EXPECT_NE(std::find(three.begin(), three.end(), "irq:irq_handler_entry"), three.end());
    EXPECT_EQ(std::find(two.begin(), two.end(), "irq:irq_handler_entry"), two.end());
}

TEST(ALinuxSpanTraceRecorder, RecordsMarkersInAnInstanceOfItsOwnAndAlwaysRemovesIt) {
    PrivateTracefs tracefs;
    if (!tracefs.mounted()) {
        GTEST_SKIP() << tracefs.reason();
    }
    const fs::path instances = tracefs.root() / "instances";
    // Left by earlier runs: a dead process's instance goes at the first recording; a live
    // process's (this one's) and a foreign one stay.
    const long dead = unusedPid();
    ASSERT_NE(dead, 0);
    const fs::path stale = instances / fmt::format("qvreportd-{}-1", dead);
    const fs::path mine = instances / fmt::format("qvreportd-{}-999999", ::getpid());
    const fs::path foreign = instances / "someone-else";
    for (const auto& p : {stale, mine, foreign}) {
        ASSERT_EQ(::mkdir(p.c_str(), 0700), 0) << p << ": " << std::strerror(errno);
    }

    test::TempDirectory dir("qvrecorder");
    test::Notes problems;
    LinuxSpanTraceRecorder::Options options;
    options.traceDirectory = dir / "raw";
    options.tracefsRoot = tracefs.root();
    options.bufferKbPerCpu = 1024;
    options.maxTraceFiles = 1;
    // The instance of this run's recording: ours but the one an earlier run left.
    const auto recording = [&] {
        auto names = ourInstances(tracefs.root());
        names.erase(std::remove(names.begin(), names.end(), mine.filename()), names.end());
        return names;
    };
    {
        LinuxSpanTraceRecorder recorder(options, problems.callback());
        auto delegate = std::make_shared<Delegate>();
        auto session = recorder.createSession(*recorder.configurationFromTemplate(3));
        session->setDelegate(delegate);
        session->start();
        recorder.drain();
        ASSERT_EQ(delegate->calls, std::vector<std::string>{"start:ok"});
        EXPECT_TRUE(session->isValid());
        EXPECT_FALSE(fs::exists(stale));
        EXPECT_TRUE(fs::exists(mine));
        EXPECT_TRUE(fs::exists(foreign));

        const auto names = recording();
        ASSERT_EQ(names.size(), 1u);
        const fs::path instance = instances / names[0];
        // The kernel rounds the size up to whole sub-buffers.
        const int kb = std::stoi(readAll(instance / "buffer_size_kb"));
        EXPECT_GE(kb, 1024);
        EXPECT_LT(kb, 1100);
        // (The clock, the first template's events and the trace's header line: the end-to-end
        // Trace test.)
        if (fs::exists(instance / "events/irq/irq_handler_entry")) {
            EXPECT_EQ(readAll(instance / "events/irq/irq_handler_entry/enable"), "1\n");
        }

        // Markers coming back as durations is the end-to-end Trace test's part.
        session->stop();
        recorder.drain();
        EXPECT_EQ(delegate->calls,
                  (std::vector<std::string>{"start:ok", "stop:ok", "complete:ok"}));
        EXPECT_FALSE(session->isValid());
        ASSERT_TRUE(delegate->location);
        EXPECT_EQ(delegate->location->parent_path(), dir / "raw");
        EXPECT_EQ(delegate->token, names[0]);

        // A recording released without a stop still has its instance removed.
        auto abandoned = recorder.createSession(*recorder.configurationFromTemplate(2));
        abandoned->start();
        recorder.drain();
        EXPECT_EQ(ourInstances(tracefs.root()).size(), 2u);
        abandoned.reset();
        recorder.drain();
        EXPECT_EQ(ourInstances(tracefs.root()), std::vector<std::string>{mine.filename()});

        // One left running when the recorder goes.
        auto running = recorder.createSession(*recorder.configurationFromTemplate(2));
        running->start();
        recorder.drain();
        EXPECT_EQ(ourInstances(tracefs.root()).size(), 2u);
    }
    EXPECT_EQ(ourInstances(tracefs.root()), std::vector<std::string>{mine.filename()});

    // A trace larger than the cap is cut after a whole line, and only the newest trace is kept.
    options.maxTraceBytes = 4096;
    {
        LinuxSpanTraceRecorder recorder(options, problems.callback());
        auto delegate = std::make_shared<Delegate>();
        auto session = recorder.createSession(*recorder.configurationFromTemplate(2));
        session->setDelegate(delegate);
        session->start();
        recorder.drain();
        const auto names = recording();
        ASSERT_EQ(names.size(), 1u);
        for (int i = 0; i < 200; ++i) {
            writeMarker(instances / names[0] / "trace_marker", fmt::format("qv:many:{}", i));
        }
        session->stop();
        recorder.drain();
        ASSERT_TRUE(delegate->location);
        const std::string text = readAll(*delegate->location);
        EXPECT_NE(text.find("\n# qvreportd: trace cut at "), std::string::npos);
        EXPECT_LT(text.size(), 4096u + 200u);
        EXPECT_EQ(std::distance(fs::directory_iterator(dir / "raw"), {}), 1);
    }
    EXPECT_EQ(problems.containing("was cut at its cap of 4096 bytes"), 1u);
    for (const auto& p : {mine, foreign}) {
        ::rmdir(p.c_str());
    }
}

}  // namespace
}  // namespace qv
