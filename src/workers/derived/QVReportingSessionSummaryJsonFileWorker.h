// Writes, when a session stops, every non-redundant message of the session into one JSON file in
// the diagnostic-log directory, so that engineers can read a session's whole traffic. Only
// sessions of the "test" service type, or any session on an internal build, get this worker.
//
// The file, "<local time yyyyMMdd-HHmmssZ>-<reporter ID>-<application>-<service>.json", is a JSON
// array written line by line: "[", each message as a pretty-printed object
// {"<category>_<type>_<n>": payload with "isSessionStarted"}, "," between two objects, "]". It is
// opened at the first message to write, so an empty session leaves no file. The parts of the name
// that clients choose are made safe, so the file always lands in the directory. It is written
// under a hidden temporary name (".<name>.partial") beside it, synced and renamed when whole, so a
// reader never sees half a file; when a write fails (a full disk) the temporary file is removed
// and no file is left. File errors are logged; the session goes on.
//
// Thread safety: called on the session's queue, like every worker.
#pragma once

#include <filesystem>
#include <memory>
#include <string>
#include <string_view>

#include "platform/Platform.h"
#include "session/QVReportingSessionWorker.h"

namespace qv {

// The directory of the session summary files.
std::filesystem::path QVReportingLogsDirectory(const Platform& platform);

class QVReportingSessionSummaryJsonFileWorker final : public QVReportingSessionWorkerProtocol {
  public:
    static constexpr std::string_view kClassName = "QVReportingSessionSummaryJsonFileWorker";

    // Null unless the session is a "test" session or the build is internal.
    static std::shared_ptr<QVReportingSessionSummaryJsonFileWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);
    ~QVReportingSessionSummaryJsonFileWorker() override;

    void stop() override;

    void openFile();
    void writeLine(std::string_view line);
    void closeFile();

    // The file's path while one is being written (also after a failed open); empty otherwise.
    const std::string& reportPath() const { return reportPath_; }

  private:
    static constexpr std::size_t kWriteChunk = 256 * 1024;

    void writePending();

    std::string reportPath_;
    std::string tempPath_;  // where the file is written until it is whole
    int reportFileHandle_ = -1;
    bool writeFailed_ = false;
    std::string pending_;  // lines not yet written
};

}  // namespace qv
