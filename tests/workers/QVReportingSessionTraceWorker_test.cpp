#include "workers/diagnostics/QVReportingSessionTraceWorker.h"

#include <fstream>

#include "fakes/FakeClockSemaphore.h"
#include "fakes/TempDirectory.h"
#include "workers/WorkerTestSupport.h"

namespace qv {
namespace {

namespace fs = std::filesystem;
using Worker = QVReportingSessionTraceWorker;

constexpr const char* kProbeList = R"(<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0">
<array>
  <dict>
    <key>Name</key><string>render</string>
    <key>Children</key>
    <array>
      <dict><key>Name</key><string>mix</string></dict>
      <dict><key>Name</key><string>output</string></dict>
    </array>
  </dict>
  <dict><key>Name</key><string>decode</string></dict>
</array>
</plist>
)";

ThreadlineProbe leaf(const std::string& name, std::vector<std::uint64_t> ticks) {
    ThreadlineProbe probe;
    probe.name = name;
    probe.description = "<" + name + ">";
    for (auto t : ticks) {
        probe.events.push_back({name, t});
    }
    return probe;
}

class ATraceWorker : public ::testing::Test {
  protected:
    void SetUp() override {
        fake.device.internalBuild = true;
        fake.device.logsDirectory = dir / "logs";
        probeList = dir / "probes.plist";
        std::ofstream(probeList) << kProbeList;
        trace = dir / "recorded.trace";
        std::ofstream(trace) << "# a trace\n";
        fake.spanTrace.traceLocation = trace;

        auto& model = *fake.threadline.model;
        ThreadlineProbe render;
        render.name = "render";
        render.children = {leaf("mix", {1500, 2500}), leaf("output", {3})};
        model.probes["render"] = render;
        model.probes["decode"] = leaf("decode", {1000000});
        model.secondsPerTick = 1e-6;
    }
    std::shared_ptr<QVReportingSession> make(AudioServiceType type, Dictionary config) {
        return test::makeSession(fake.platform,
                                 {.serviceType = type, .configuration = std::move(config)});
    }
    Dictionary config() const {
        return {{"KXHostApplicationDisplayID", "../com.example/player"},
                {std::string(QVReportingThreadlinePlistFilePath), probeList.string()}};
    }
    // A worker whose waits pass on the fake clock.
    std::shared_ptr<Worker> worker(const std::shared_ptr<QVReportingSession>& session) {
        auto semaphore = std::make_unique<test::FakeClockSemaphore>(fake.clock);
        waits = semaphore.get();
        return Worker::TEST_initWithSession(session, std::move(semaphore));
    }
    // Records a test session of this configuration once: whether the start was reported. The
    // worker stays, and with it what waits reads.
    bool recordOnce(const Dictionary& configuration) {
        recordedSession = make(service::kTest, configuration);
        recorded = worker(recordedSession);
        const bool started = recorded->start();
        recorded->stop();
        return started;
    }
    std::vector<std::string> written() const {
        std::vector<std::string> lines;
        for (const auto& file : fake.gaugeData.files) {
            for (const auto& v : file->values) {
                lines.push_back(v.name + " " + v.unit + " " + std::to_string(v.value));
            }
        }
        return lines;
    }

    test::ScopedWorkerClasses<> workerClasses;
    test::TempDirectory dir{"qvtraceworker"};
    fs::path probeList;
    fs::path trace;
    test::FakePlatform fake;
    test::FakeClockSemaphore* waits = nullptr;
    std::shared_ptr<QVReportingSession> recordedSession;
    std::shared_ptr<Worker> recorded;
};

TEST_F(ATraceWorker, RecordsATestSessionAndWritesEveryEventInMillisecondsDepthFirst) {
    fake.clock.setNow(1706707501.0);
    auto session = make(service::kTest, config());
    auto w = worker(session);
    ASSERT_TRUE(w->start());
    ASSERT_EQ(fake.spanTrace.sessions.size(), 1u);
    const auto& recording = *fake.spanTrace.sessions[0];
    EXPECT_EQ(recording.configuration.templateNumber, 2);
    EXPECT_FALSE(recording.configuration.compressWhenFinished);
    EXPECT_EQ(recording.starts, 1);
    EXPECT_TRUE(w->start()) << "a second start records nothing more";
    EXPECT_EQ(fake.spanTrace.sessions.size(), 1u);

    w->stop();
    EXPECT_EQ(recording.stops, 1);
    EXPECT_FALSE(recording.hasDelegate()) << "the delegate is cleared at completion";
    EXPECT_EQ(waits->waits, (std::vector<double>{15.0, 180.0}));
    EXPECT_TRUE(waits->timeouts.empty());
    ASSERT_EQ(fake.threadline.locations, std::vector<fs::path>{trace});
    ASSERT_EQ(fake.threadline.model->asked.size(), 1u);
    EXPECT_EQ(fake.threadline.model->asked[0].size(), 2u) << "a root array gives every element";

    ASSERT_EQ(fake.gaugeData.files.size(), 1u);
    const auto& gdj = *fake.gaugeData.files[0];
    EXPECT_EQ(gdj.path, dir / "logs/Audio/Traces/temp_gaugedata.gdj");
    EXPECT_TRUE(gdj.closed);
    EXPECT_EQ(written(), (std::vector<std::string>{
                             "mix milliseconds 1.500000", "mix milliseconds 2.500000",
                             "output milliseconds 0.003000", "decode milliseconds 1000.000000"}));

    // Moved to its generated name; the client's application name cannot leave the directory.
    const auto results = test::filesIn(dir / "logs/Audio/Traces");
    ASSERT_EQ(results.size(), 1u);
    const std::string name = results[0].filename().string();
    EXPECT_EQ(test::timeStampShape(name), "99999999+999999+9999") << name;
    EXPECT_EQ(name.substr(20), "-qvsound-%2E.%2Fcom.example%2Fplayer-test.gdj");
    EXPECT_EQ(results[0].string(), w->fullWriterPath());
}

TEST_F(ATraceWorker, RecordsOnlyTestSessionsOnInternalBuildsWithAProbeList) {
    test::ScopedMemoryLog log;
    QVReportingWorkerRegistry::TEST_reset({&makeWorkerClass<Worker>()});
    // Not a test session: the worker exists but never records, and is not stopped.
    auto telephony = make(service::kTelephony, config());
    telephony->start();
    telephony->stop();
    // A test session on a customer build.
    test::setInternalBuild(fake.device, false);
    auto customer = make(service::kTest, config());
    customer->start();
    customer->stop();
    EXPECT_TRUE(fake.spanTrace.templatesAsked.empty());

    test::setInternalBuild(fake.device, true);
    Dictionary missing = config();
    missing.set(QVReportingThreadlinePlistFilePath, (dir / "absent.plist").string());
    auto noList = make(service::kTest, missing);
    noList->start();
    EXPECT_TRUE(log->contains("Could not start SpanTrace. QVReportingThreadlinePlistFilePath: " +
                              (dir / "absent.plist").string() + " is not a valid path"));
    missing.erase(QVReportingThreadlinePlistFilePath);
    auto wSession = make(service::kTest, missing);
    auto w = worker(wSession);
    EXPECT_FALSE(w->start());
    EXPECT_TRUE(log->contains("QVReportingThreadlinePlistFilePath: (null) is not a valid path"));
    EXPECT_TRUE(fake.spanTrace.templatesAsked.empty());

    // The same session with a probe list, through the registry, its real semaphore and a profile.
    Dictionary profile = config();
    profile.set(QVReportingTraceType, "artrace_profile");
    auto test = make(service::kTest, profile);
    test->start();
    test->stop();
    EXPECT_EQ(fake.spanTrace.templatesAsked, std::vector<int>{3});
    EXPECT_EQ(test::filesIn(dir / "logs/Audio/Traces").size(), 1u);
}

TEST_F(ATraceWorker, StopsAValidRecordingWhenItsStartIsNotReportedInFifteenSeconds) {
    test::ScopedMemoryLog log;
    fake.spanTrace.startAnswer = test::FakeSpanTraceRecorder::Answer::Never;
    auto wSession = make(service::kTest, config());
    auto w = worker(wSession);
    const double before = fake.clock.now();
    EXPECT_FALSE(w->start());
    EXPECT_EQ(waits->timeouts, std::vector<double>{15.0});
    EXPECT_DOUBLE_EQ(fake.clock.now() - before, 15.0);
    EXPECT_TRUE(log->contains("timed out waiting for performance trace to start"));
    ASSERT_EQ(fake.spanTrace.sessions.size(), 1u);
    EXPECT_EQ(fake.spanTrace.sessions[0]->stops, 1) << "the valid recording is stopped";
    EXPECT_FALSE(w->start()) << "the worker records at most once";
    EXPECT_EQ(fake.spanTrace.sessions.size(), 1u);
}

TEST_F(ATraceWorker, LeavesNoResultsFileWhenTheTraceDoesNotCompleteInThreeMinutes) {
    test::ScopedMemoryLog log;
    fake.spanTrace.stopAnswer = test::FakeSpanTraceRecorder::Answer::Never;
    ASSERT_TRUE(recordOnce(config()));
    EXPECT_EQ(waits->timeouts, std::vector<double>{180.0});
    EXPECT_EQ(log->count("timed out waiting for performance trace to stop.  No gdj file wil be "
                         "generated. "),
              1u);
    EXPECT_TRUE(fake.threadline.locations.empty());
    EXPECT_TRUE(fake.gaugeData.files.empty());
    EXPECT_TRUE(test::filesIn(dir / "logs/Audio/Traces").empty());
}

TEST_F(ATraceWorker, TakesTheFailurePathsOfTheRecorderWithoutWaitingOrWriting) {
    test::ScopedMemoryLog log;
    // The recorder cannot trace (tracefs unusable): start fails and completes at once. (Its log
    // lines, and that nothing waits: the trace end-to-end test without tracefs.)
    fake.spanTrace.startError = "tracefs is not mounted";
    auto wSession = make(service::kTest, config());
    auto w = worker(wSession);
    w->start();
    w->stop();
    EXPECT_EQ(fake.spanTrace.sessions[0]->stops, 0) << "a failed recording is not stopped";

    // The trace could not be written: completion reports an error; stop errors are logged too.
    fake.spanTrace.startError.reset();
    fake.spanTrace.stopError = "cannot switch tracing off";
    fake.spanTrace.completeError = "disk full";
    ASSERT_TRUE(recordOnce(config()));
    EXPECT_TRUE(log->contains("spanTraceDidStop cannot switch tracing off"));
    EXPECT_TRUE(log->contains("spanTraceDidComplete disk full"));
    EXPECT_EQ(log->count("No traceResults at path: (null)"), 2u);
    EXPECT_TRUE(fake.gaugeData.files.empty());
}

TEST_F(ATraceWorker, RefusesProbeListsItCannotUseAndWritesNothingForThem) {
    struct Case {
        const char* text;
        const char* logged;
        std::size_t dictionaries;  // handed to the model
    };
    const std::vector<Case> cases = {
        {R"(<plist version="1.0"><dict><key>Name</key><string>decode</string></dict></plist>)",
         "decode, <decode>", 1},
        {R"(<plist version="1.0"><string>decode</string></plist>)", "unsupported root class string",
         0},
        {R"(<plist version="1.0"><array><string>x</string><dict><key>Name</key><string>decode</string></dict></array></plist>)",
         "Threadline probe 0 skipped: a string, not a dictionary", 1},
        {R"(<plist version="1.0"><array><dict><key>Name</key><string>nope</string></dict></array></plist>)",
         "Threadline probe skipped: unknown probe nope", 1},
        {"not a property list", " failed to get ThreadlineProbes from ", 0},
        {R"(<plist version="1.0"><dict><key>Name</key></plist>)",
         " failed to get ThreadlineProbes from ", 0},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.text);
        test::ScopedMemoryLog log;
        std::ofstream(probeList, std::ios::trunc) << c.text;
        fake.threadline.model->asked.clear();
        fake.gaugeData.files.clear();
        ASSERT_TRUE(recordOnce(config()));
        EXPECT_TRUE(log->contains(c.logged));
        const std::size_t asked =
            fake.threadline.model->asked.empty() ? 0 : fake.threadline.model->asked[0].size();
        EXPECT_EQ(asked, c.dictionaries);
        EXPECT_EQ(fake.gaugeData.files.size(), c.dictionaries > 0 ? 1u : 0u);
    }

    // A probe list that vanished between start and stop.
    test::ScopedMemoryLog log;
    auto wSession = make(service::kTest, config());
    auto w = worker(wSession);
    ASSERT_TRUE(w->start());
    fs::remove(probeList);
    w->stop();
    EXPECT_TRUE(
        log->contains("cannot open the file: No such file or directory failed to get "
                      "ThreadlineProbes from " +
                      probeList.string()));
}

TEST_F(ATraceWorker, LogsModelWriterAndMoveFailuresAndGoesOn) {
    test::ScopedMemoryLog log;
    fake.threadline.error = "not a trace";
    ASSERT_TRUE(recordOnce(config()));
    EXPECT_TRUE(log->contains("failed to create Threadline model: not a trace"));
    EXPECT_TRUE(fake.gaugeData.files.empty());

    fake.threadline.error.reset();
    fake.gaugeData.openError = EACCES;
    ASSERT_TRUE(recordOnce(config()));
    EXPECT_TRUE(log->contains("Failed to open gaugedata writer. errno: 13"));
    EXPECT_TRUE(log->contains("Failed to move file")) << "no temporary file to move";
    EXPECT_TRUE(log->contains("name:decode time:1000.000000 ms")) << "probes still evaluated";
}

TEST_F(ATraceWorker, KeepsItsResultsInsideTheDiagnosticLogDirectory) {
    const fs::path logs = dir / "logs";
    const fs::path fallback = logs / "Audio/Traces";
    fs::create_directories(logs);
    fs::create_directory_symlink("/tmp", logs / "escape");
    struct Case {
        Value configured;
        fs::path expected;
    };
    const std::vector<Case> cases = {
        {"runs/a", logs / "runs/a"},     {(logs / "Audio/Custom").string(), logs / "Audio/Custom"},
        {"runs/../b", logs / "b"},       {"", fallback},
        {"../outside", fallback},        {"runs/../../outside", fallback},
        {"/tmp/qv", fallback},           {"/", fallback},
        {"escape/inside-tmp", fallback}, {7, logs / "7"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.configured.description());
        std::string refusal;
        EXPECT_EQ(Worker::outputDirectory(logs, &c.configured, &refusal), c.expected);
        EXPECT_EQ(refusal.empty(), c.expected != fallback || c.configured == Value(""));
    }
    EXPECT_EQ(Worker::outputDirectory(logs, nullptr, nullptr), fallback);

    // End to end: a hostile name and a directory outside both stay inside.
    test::ScopedMemoryLog log;
    Dictionary hostile = config();
    hostile.set(QVReportingThreadlineOutputFileDirectory, "../../elsewhere");
    hostile.set(QVReportingThreadlineOutputFileName, "../../etc/results.gdj");
    ASSERT_TRUE(recordOnce(hostile));
    EXPECT_TRUE(log->contains("refusing QVReportingThreadlineOutputFileDirectory: "));
    const auto results = test::filesIn(fallback);
    ASSERT_EQ(results.size(), 1u);
    EXPECT_EQ(results[0].filename(), "%2E.%2F..%2Fetc%2Fresults.gdj");
}

}  // namespace
}  // namespace qv
