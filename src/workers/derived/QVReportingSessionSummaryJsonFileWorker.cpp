#include "workers/derived/QVReportingSessionSummaryJsonFileWorker.h"

#include <fcntl.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <cstring>
#include <map>
#include <system_error>

#include <fmt/format.h>

#include "platform/Clock.h"
#include "platform/DeviceInformation.h"
#include "platform/PosixIO.h"
#include "platform/SafeFileName.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingUtility.h"
#include "session/QVReportingVocabulary.h"
#include "values/ValueJson.h"

namespace qv {

namespace {

// Each message is written as a pretty-printed object, this many blanks a level.
constexpr int kJsonIndent = 2;

}  // namespace

std::filesystem::path QVReportingLogsDirectory(const Platform& platform) {
    return platform.device.diagnosticLogsDirectory() / "Audio" / "Reporting";
}

std::shared_ptr<QVReportingSessionSummaryJsonFileWorker>
QVReportingSessionSummaryJsonFileWorker::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    if (!session || (session->serviceType() != service::kTest &&
                     !QVReportingUtilityIsInternalBuild(session->platform()))) {
        return nullptr;
    }
    auto worker = std::make_shared<QVReportingSessionSummaryJsonFileWorker>();
    worker->setSession(session);
    worker->setStarted(true);
    return worker;
}

QVReportingSessionSummaryJsonFileWorker::~QVReportingSessionSummaryJsonFileWorker() {
    if (reportFileHandle_ >= 0) {
        ::close(reportFileHandle_);
        ::unlink(tempPath_.c_str());
    }
}

void QVReportingSessionSummaryJsonFileWorker::openFile() {
    const auto owner = session();
    if (!owner) {
        return;
    }
    const std::filesystem::path directory = QVReportingLogsDirectory(owner->platform());
    std::error_code ec;
    std::filesystem::create_directories(directory, ec);
    if (ec) {
        QVLOG_ERROR(QVReportingSummaryLogCategory(), "can't create logging directory at {}: {}",
                    directory.string(), ec.message());
    }
    // Whatever the client named its application, the name stays one file in this directory.
    const std::string name = fmt::format(
        "{}-{}-{}-{}.json", QVReportingUtilityFileTimestamp(owner->platform().clock.now()),
        owner->reporterID(),
        QVReportingSafeFileComponent(QVReportingUtilityRetrieveAppName(owner->configuration())),
        QVReportingSafeFileComponent(owner->serviceName(), 64));
    reportPath_ = (directory / name).string();
    tempPath_ = (directory / ("." + name + ".partial")).string();
    writeFailed_ = false;
    reportFileHandle_ =
        ::open(tempPath_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0666);
    if (reportFileHandle_ < 0) {
        QVLOG_ERROR(QVReportingSummaryLogCategory(),
                    "SummaryJsonFileWorker failed to open file. action=open file={} error=\"{}\"",
                    reportPath_, std::strerror(errno));
        setStarted(false);
        return;
    }
    QVLOG_INFO(QVReportingSummaryLogCategory(),
               "SummaryJsonFileWorker opened file. action=open file={}", reportPath_);
    setStarted(true);
    writeLine("[");
}

void QVReportingSessionSummaryJsonFileWorker::writeLine(std::string_view line) {
    pending_.append(line);
    pending_ += '\n';
    // Lines are gathered and written in large pieces: a session of many messages would otherwise
    // cost two system calls a message. Without an open file each line fails, and says so, at once.
    if (pending_.size() >= kWriteChunk || reportFileHandle_ < 0) {
        writePending();
    }
}

void QVReportingSessionSummaryJsonFileWorker::writePending() {
    // After a failure the rest is not written: the file will not be kept.
    const bool written = !writeFailed_ && writeAll(reportFileHandle_, pending_);
    pending_.clear();
    if (!written && !writeFailed_) {
        writeFailed_ = reportFileHandle_ >= 0;
        QVLOG_ERROR(
            QVReportingSummaryLogCategory(),
            "SummaryJsonFileWorker failed to write line. action=writeline file={} error=\"{}\"",
            reportPath_, std::strerror(errno));
    }
}

void QVReportingSessionSummaryJsonFileWorker::closeFile() {
    writeLine("]");
    writePending();
    int error = writeFailed_ ? EIO : 0;
    if (error == 0 && ::fsync(reportFileHandle_) != 0) {
        error = errno;
    }
    if (::close(reportFileHandle_) != 0 && error == 0) {
        error = errno;
    }
    reportFileHandle_ = -1;
    if (error == 0 && ::rename(tempPath_.c_str(), reportPath_.c_str()) != 0) {
        error = errno;
    }
    if (error != 0) {
        ::unlink(tempPath_.c_str());
        QVLOG_ERROR(QVReportingSummaryLogCategory(),
                    "SummaryJsonFileWorker failed to closed file. action=close file={} "
                    "error=\"{}\" (no file left)",
                    reportPath_, writeFailed_ ? "a write failed" : std::strerror(error));
    } else {
        QVLOG_INFO(QVReportingSummaryLogCategory(),
                   "SummaryJsonFileWorker closed file. action=close file={}", reportPath_);
    }
}

void QVReportingSessionSummaryJsonFileWorker::stop() {
    const auto owner = session();
    if (!owner || owner->messages().empty()) {
        return;
    }
    std::map<std::string, std::uint64_t> counters;
    const auto& messages = owner->messages();
    for (std::size_t i = 0; i < messages.size(); ++i) {
        QVReportingSessionMessage& message = *messages[i];
        if (message.isRedundant()) {
            continue;
        }
        if (!reportPath_.empty()) {
            writeLine(",");
        } else {
            openFile();
        }
        std::string key = QVReportingUtilityCategoryString(message.category());
        key += '_';
        key += QVReportingUtilityTypeString(message.type());
        const std::uint64_t n = ++counters[key];
        message.message().set("isSessionStarted", message.isSessionStarted() ? "YES" : "NO");
        const Value member(Dictionary{{key + '_' + std::to_string(n), Value(message.message())}});
        std::string text;
        text.reserve(1024);
        if (QVReportingAppendJsonText(text, member, kJsonIndent)) {
            writeLine(text);
        } else {
            QVLOG_ERROR(QVReportingSummaryLogCategory(), "dataWithJSONObject: {}",
                        "a string of the message is not valid UTF-8");
        }
    }
    if (!reportPath_.empty()) {
        closeFile();
        reportPath_.clear();
    }
}

}  // namespace qv
