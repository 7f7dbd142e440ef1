// Records a system performance trace for the lifetime of a "test" session on an internal build
// and, when the session stops, evaluates it against the client's probe list, writing each probe
// event's duration in milliseconds to a gauge-data results file. In every other session it does
// nothing.
//
// The session's configuration drives it:
//   QVReportingThreadlinePlistFilePath        the probe list, an XML property list (a probe
//                                             dictionary or an array of them; keys in
//                                             platform/ThreadlineModelReader.h); must exist for
//                                             tracing to start
//   QVReportingTraceType                      "artrace_profile": recording template 3, else 2
//   QVReportingThreadlineOutputFileDirectory  where the results go, inside the diagnostic-log
//                                             directory (see below); default logs Audio/Traces
//   QVReportingThreadlineOutputFileName       the results file's name; default
//                                             "<yyyyMMdd-HHmmssZ>-qvsound-<app>-<service>.gdj"
// The configuration comes from a client, so the results stay inside the diagnostic-log
// directory: a relative directory is taken under it, an absolute one must lie in it, and one that
// would leave it (through "..", or a symbolic link) is refused with an error line and the default
// directory used instead. The file name, given or generated, is made one safe file name.
//
// start waits up to kStartTimeoutSeconds for the recorder to report that it runs, stop up to
// kStopTimeoutSeconds for the finished trace: both block the reporting server queue by design, so
// the recorder must answer promptly. The recorder's callbacks arrive on its own thread; they only
// store what they bring (under a lock of this worker's) and signal the semaphore.
//
// Thread safety: start and stop run on the session's queue; the SpanTraceDelegate callbacks may
// run on any thread.
#pragma once

#include <filesystem>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/GaugeDataWriter.h"
#include "platform/SpanTraceRecorder.h"
#include "platform/ThreadlineModelReader.h"
#include "session/QVReportingSemaphore.h"
#include "session/QVReportingSessionWorker.h"

namespace qv {

// Session configuration keys of the trace worker.
inline constexpr std::string_view QVReportingThreadlinePlistFilePath =
    "QVReportingThreadlinePlistFilePath";
inline constexpr std::string_view QVReportingTraceType = "QVReportingTraceType";
inline constexpr std::string_view QVReportingThreadlineOutputFileDirectory =
    "QVReportingThreadlineOutputFileDirectory";
inline constexpr std::string_view QVReportingThreadlineOutputFileName =
    "QVReportingThreadlineOutputFileName";

class QVReportingSessionTraceWorker final
    : public QVReportingSessionWorkerProtocol,
      public SpanTraceDelegate,
      public std::enable_shared_from_this<QVReportingSessionTraceWorker> {
  public:
    static constexpr std::string_view kClassName = "QVReportingSessionTraceWorker";
    static constexpr double kStartTimeoutSeconds = 15.0;
    static constexpr double kStopTimeoutSeconds = 180.0;
    static constexpr std::string_view kProfileTraceType = "artrace_profile";
    static constexpr std::string_view kTemporaryFileName = "temp_gaugedata.gdj";

    static std::shared_ptr<QVReportingSessionTraceWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    bool start() override;
    void stop() override;

    // Reads the trace at location and writes the results file.
    void processTraceThreadline(const std::optional<std::filesystem::path>& location);
    // Opens the results writer on the temporary file of the output directory.
    void createGaugeWriter();
    // Writes the events of probe, or of its children, depth first.
    void processProbe(const ThreadlineProbe& probe);

    void spanTraceDidStart(const std::optional<std::string>& error) override;
    void spanTraceDidStop(const std::optional<std::string>& error) override;
    void spanTraceDidComplete(const std::optional<std::filesystem::path>& location,
                              const std::string& token,
                              const std::optional<std::string>& error) override;

    bool startedTracing() const { return startedTracing_; }
    const std::string& fullWriterPath() const { return fullWriterPath_; }
    const std::string& tempWriterPath() const { return tempWriterPath_; }

    // The directory the results go to for a configured value (null: none configured), given the
    // diagnostic-log directory; when the configured one is refused, refusal says why and the
    // default is returned.
    static std::filesystem::path outputDirectory(const std::filesystem::path& logsDirectory,
                                                 const Value* configured, std::string* refusal);

    // For tests: a worker whose waits go through the given semaphore (a fake clock's, say).
    static std::shared_ptr<QVReportingSessionTraceWorker> TEST_initWithSession(
        const std::shared_ptr<QVReportingSession>& session,
        std::unique_ptr<QVReportingSemaphore> semaphore);

    explicit QVReportingSessionTraceWorker(std::unique_ptr<QVReportingSemaphore> semaphore);

  private:
    bool isTestSessionOnInternalBuild() const;

    // Set and read on the session's queue only.
    bool startedTracing_ = false;
    std::unique_ptr<GaugeDataFile> mWriter_;
    std::string mOutputFile_;
    const std::string mGaugeDataName_ = "QVReporting";
    const int mResultsVersion_ = 4;
    std::filesystem::path pathToGDJ_;
    std::string fullWriterPath_;
    std::string tempWriterPath_;
    // The model being evaluated, while processTraceThreadline runs.
    std::shared_ptr<const ThreadlineModel> threadlineModel_;

    // Signalled by the recorder's start and completion callbacks.
    const std::unique_ptr<QVReportingSemaphore> mTraceDispatchSemaphore_;

    // Written by the recorder's callbacks too.
    std::mutex mutex_;
    std::shared_ptr<SpanTraceConfiguration> traceConfig_;  // guarded by mutex_
    std::shared_ptr<SpanTraceSession> traceSession_;       // guarded by mutex_
    std::optional<std::filesystem::path> finalTraceURL_;   // guarded by mutex_
};

}  // namespace qv
