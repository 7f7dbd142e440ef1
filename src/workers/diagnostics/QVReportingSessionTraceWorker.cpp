#include "workers/diagnostics/QVReportingSessionTraceWorker.h"

#include <time.h>

#include <cmath>
#include <system_error>
#include <vector>

#include <fmt/format.h>

#include "platform/Clock.h"
#include "platform/DeviceInformation.h"
#include "platform/SafeFileName.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingUtility.h"
#include "workers/diagnostics/QVReportingPropertyListFile.h"

namespace qv {

namespace {

namespace fs = std::filesystem;

std::optional<std::string> configuredString(const Dictionary& configuration, std::string_view key) {
    const Value* value = configuration.find(key);
    if (value && value->isString()) {
        return *value->asString();
    }
    return std::nullopt;
}

// What a root that is neither an array nor a dictionary holds, for the log.
std::string_view kindName(const Value& value) {
    switch (value.kind()) {
        case Value::Kind::Bool:
            return "boolean";
        case Value::Kind::Int:
        case Value::Kind::UInt:
            return "integer";
        case Value::Kind::Double:
            return "real";
        case Value::Kind::String:
            return "string";
        case Value::Kind::Bytes:
            return "data";
        case Value::Kind::Date:
            return "date";
        case Value::Kind::Array:
            return "array";
        case Value::Kind::Dictionary:
            return "dictionary";
        case Value::Kind::Null:
            break;
    }
    return "null";
}

// Whether path lies in base (or is base); both already absolute and normalised.
bool isWithin(const fs::path& path, const fs::path& base) {
    auto p = path.begin();
    for (auto b = base.begin(); b != base.end(); ++b, ++p) {
        if (b->empty()) {
            continue;  // a trailing separator
        }
        if (p == path.end() || *p != *b) {
            return false;
        }
    }
    return true;
}

}  // namespace

QVReportingSessionTraceWorker::QVReportingSessionTraceWorker(
    std::unique_ptr<QVReportingSemaphore> semaphore)
    : mTraceDispatchSemaphore_(std::move(semaphore)) {}

std::shared_ptr<QVReportingSessionTraceWorker> QVReportingSessionTraceWorker::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    return TEST_initWithSession(session, std::make_unique<QVReportingSemaphore>(0));
}

std::shared_ptr<QVReportingSessionTraceWorker> QVReportingSessionTraceWorker::TEST_initWithSession(
    const std::shared_ptr<QVReportingSession>& session,
    std::unique_ptr<QVReportingSemaphore> semaphore) {
    if (!session || !semaphore) {
        return nullptr;
    }
    auto worker = std::make_shared<QVReportingSessionTraceWorker>(std::move(semaphore));
    worker->setSession(session);
    return worker;
}

bool QVReportingSessionTraceWorker::isTestSessionOnInternalBuild() const {
    const auto owner = session();
    return owner && owner->serviceType() == service::kTest &&
           QVReportingUtilityIsInternalBuild(owner->platform());
}

bool QVReportingSessionTraceWorker::start() {
    if (startedTracing_) {
        return started();
    }
    const auto owner = session();
    if (!owner || !isTestSessionOnInternalBuild()) {
        return started();
    }
    const Dictionary& configuration = owner->configuration();
    const auto probeList = configuredString(configuration, QVReportingThreadlinePlistFilePath);
    std::error_code ec;
    if (!probeList || probeList->empty() || !fs::exists(*probeList, ec)) {
        QVLOG_ERROR(QVReportingTraceCategory(),
                    "Could not start SpanTrace. QVReportingThreadlinePlistFilePath: {} is not a "
                    "valid path",
                    QVReportingValueText(configuration.find(QVReportingThreadlinePlistFilePath)));
        return started();
    }

    const int templateNumber =
        configuredString(configuration, QVReportingTraceType) == kProfileTraceType ? 3 : 2;
    SpanTraceRecorder& recorder = owner->platform().spanTrace;
    auto config = recorder.configurationFromTemplate(templateNumber);
    if (!config) {
        QVLOG_ERROR(QVReportingTraceCategory(),
                    "Could not start SpanTrace. No recording template {}", templateNumber);
        return started();
    }
    config->compressWhenFinished = false;
    auto recording = recorder.createSession(*config);
    recording->setDelegate(weak_from_this());
    {
        std::lock_guard lock(mutex_);
        traceConfig_ = config;
        traceSession_ = recording;
    }
    startedTracing_ = true;
    recording->start();

    if (mTraceDispatchSemaphore_->wait(kStartTimeoutSeconds)) {
        setStarted(true);
    } else {
        QVLOG_DEFAULT(QVReportingTraceCategory(),
                      "timed out waiting for performance trace to start");
        std::shared_ptr<SpanTraceSession> current;
        {
            std::lock_guard lock(mutex_);
            current = traceSession_;
        }
        if (current && current->isValid()) {
            current->stop();
        }
    }
    return started();
}

void QVReportingSessionTraceWorker::spanTraceDidStart(const std::optional<std::string>& error) {
    if (error) {
        std::shared_ptr<SpanTraceSession> dropped;
        {
            std::lock_guard lock(mutex_);
            dropped = std::move(traceSession_);
            traceConfig_.reset();
        }
        QVLOG_ERROR(QVReportingTraceCategory(), "spanTraceDidStart {}", *error);
    } else {
        QVLOG_INFO(QVReportingTraceCategory(), "Performance Trace Started");
    }
    mTraceDispatchSemaphore_->signal();
}

void QVReportingSessionTraceWorker::spanTraceDidStop(const std::optional<std::string>& error) {
    if (error) {
        std::shared_ptr<SpanTraceSession> dropped;
        {
            std::lock_guard lock(mutex_);
            dropped = std::move(traceSession_);
        }
        QVLOG_ERROR(QVReportingTraceCategory(), "spanTraceDidStop {}", *error);
    } else {
        QVLOG_INFO(QVReportingTraceCategory(), "Performance Trace Stopped");
    }
}

void QVReportingSessionTraceWorker::spanTraceDidComplete(
    const std::optional<std::filesystem::path>& location, const std::string& /*token*/,
    const std::optional<std::string>& error) {
    std::shared_ptr<SpanTraceSession> finished;
    {
        std::lock_guard lock(mutex_);
        finished = std::move(traceSession_);
        if (!error) {
            finalTraceURL_ = location;
        }
    }
    // Released outside the lock: the recording may call back into the recorder as it goes.
    if (finished) {
        finished->setDelegate({});
        finished.reset();
    }
    if (error) {
        QVLOG_ERROR(QVReportingTraceCategory(), "spanTraceDidComplete {}", *error);
    } else {
        QVLOG_INFO(QVReportingTraceCategory(), "Performance Trace Completed: {}",
                   location ? location->string() : "(null)");
    }
    mTraceDispatchSemaphore_->signal();
}

void QVReportingSessionTraceWorker::stop() {
    if (startedTracing_ && isTestSessionOnInternalBuild()) {
        startedTracing_ = false;
        std::shared_ptr<SpanTraceSession> current;
        {
            std::lock_guard lock(mutex_);
            current = traceSession_;
        }
        if (current) {
            current->stop();
        }
    }
    if (!mTraceDispatchSemaphore_->wait(kStopTimeoutSeconds)) {
        QVLOG_DEFAULT(QVReportingTraceCategory(),
                      "timed out waiting for performance trace to stop.  No gdj file wil be "
                      "generated. ");
        return;
    }
    std::optional<fs::path> location;
    {
        std::lock_guard lock(mutex_);
        location = finalTraceURL_;
    }
    processTraceThreadline(location);
}

void QVReportingSessionTraceWorker::processTraceThreadline(
    const std::optional<std::filesystem::path>& location) {
    const std::string locationText = location ? location->string() : "(null)";
    QVLOG_DEBUG(QVReportingTraceCategory(), "Starting Threadline Process Trace. Path: {}",
                locationText);
    std::error_code ec;
    if (!location || !fs::exists(*location, ec)) {
        QVLOG_ERROR(QVReportingTraceCategory(), "No traceResults at path: {}", locationText);
        return;
    }
    const auto owner = session();
    if (!owner) {
        return;
    }

    const Value* configuredProbeList =
        owner->configuration().find(QVReportingThreadlinePlistFilePath);
    const std::string probeListPath = QVReportingValueText(configuredProbeList);
    std::vector<Dictionary> probeDictionaries;
    const auto list = configuredProbeList && configuredProbeList->isString()
                          ? QVReportingReadXMLPropertyListFile(probeListPath)
                          : QVReportingPropertyList{std::nullopt, "no path"};
    if (!list.root) {
        QVLOG_ERROR(QVReportingTraceCategory(), "{} failed to get ThreadlineProbes from {}",
                    list.error, probeListPath);
    } else if (const Array* array = list.root->asArray()) {
        std::size_t index = 0;
        for (const Value& element : *array) {
            if (const Dictionary* dictionary = element.asDictionary()) {
                probeDictionaries.push_back(*dictionary);
            } else {
                QVLOG_ERROR(QVReportingTraceCategory(),
                            "Threadline probe {} skipped: a {}, not a dictionary", index,
                            kindName(element));
            }
            ++index;
        }
    } else if (const Dictionary* dictionary = list.root->asDictionary()) {
        probeDictionaries.push_back(*dictionary);
    } else {
        QVLOG_ERROR(QVReportingTraceCategory(), "unsupported root class {}", kindName(*list.root));
    }
    if (probeDictionaries.empty()) {
        return;
    }

    auto built = owner->platform().threadline.modelFromTraceFile(*location);
    if (!built.model) {
        QVLOG_ERROR(QVReportingTraceCategory(), "failed to create Threadline model: {}",
                    built.error);
        return;
    }
    QVLOG_INFO(QVReportingTraceCategory(), "Threadline model of {}: {}", locationText,
               built.model->summary());
    threadlineModel_ = built.model;

    createGaugeWriter();

    std::vector<std::string> problems;
    const auto probes = threadlineModel_->probesFromDictionaries(probeDictionaries, &problems);
    for (const std::string& problem : problems) {
        QVLOG_ERROR(QVReportingTraceCategory(), "Threadline probe skipped: {}", problem);
    }
    for (const ThreadlineProbe& probe : probes) {
        processProbe(probe);
    }
    threadlineModel_.reset();

    if (mWriter_) {
        const int error = mWriter_->close();
        mWriter_.reset();
        if (error != 0) {
            // Half a results file is worse than none: a reader would take it for the results.
            QVLOG_ERROR(QVReportingTraceCategory(), "Failed to write gaugedata. errno: {}", error);
            fs::remove(tempWriterPath_, ec);
            return;
        }
    }
    QVLOG_DEBUG(QVReportingTraceCategory(), "Moving file from tempWriterPath: {} to {}",
                tempWriterPath_, fullWriterPath_);
    fs::rename(tempWriterPath_, fullWriterPath_, ec);
    if (ec) {
        QVLOG_ERROR(QVReportingTraceCategory(), "Failed to move file");
    }
}

fs::path QVReportingSessionTraceWorker::outputDirectory(const fs::path& logsDirectory,
                                                        const Value* configured,
                                                        std::string* refusal) {
    const fs::path fallback = logsDirectory / "Audio" / "Traces";
    if (!configured) {
        return fallback;
    }
    const std::string text = QVReportingValueText(configured);
    if (text.empty()) {
        return fallback;
    }
    std::error_code ec;
    const fs::path logs = fs::absolute(logsDirectory, ec).lexically_normal();
    fs::path wanted(text);
    wanted = (wanted.is_absolute() ? wanted : logs / wanted).lexically_normal();
    // Inside by its text ("a/../.." leaves), and inside once the links that exist already are
    // followed (a link cannot lead outside either).
    const fs::path base = fs::weakly_canonical(logs, ec);
    const fs::path resolved = ec ? fs::path() : fs::weakly_canonical(wanted, ec);
    if (!ec && isWithin(wanted, logs) && isWithin(resolved, base)) {
        return wanted;
    }
    if (refusal) {
        *refusal = fmt::format("{} is not inside the diagnostic-log directory {}", text,
                               logsDirectory.string());
    }
    return fallback;
}

void QVReportingSessionTraceWorker::createGaugeWriter() {
    const auto owner = session();
    if (!owner) {
        return;
    }
    const Dictionary& configuration = owner->configuration();
    const Platform& platform = owner->platform();
    std::string refusal;
    const fs::path directory =
        outputDirectory(platform.device.diagnosticLogsDirectory(),
                        configuration.find(QVReportingThreadlineOutputFileDirectory), &refusal);
    if (!refusal.empty()) {
        QVLOG_ERROR(QVReportingTraceCategory(),
                    "refusing QVReportingThreadlineOutputFileDirectory: {}; using {}", refusal,
                    directory.string());
    }
    std::error_code ec;
    fs::create_directories(directory, ec);
    if (ec) {
        QVLOG_ERROR(QVReportingTraceCategory(), "can't create logging directory at {}: {}",
                    directory.string(), ec.message());
    }

    const Value* configuredName = configuration.find(QVReportingThreadlineOutputFileName);
    if (configuredName && !QVReportingValueText(configuredName).empty()) {
        mOutputFile_ = QVReportingSafeFileComponent(QVReportingValueText(configuredName));
    } else {
        // The application name comes from the client: it is made safe like any file name.
        mOutputFile_ = fmt::format(
            "{}-{}-{}-{}.gdj", QVReportingUtilityFileTimestamp(platform.clock.now()), "qvsound",
            QVReportingSafeFileComponent(QVReportingUtilityRetrieveAppName(configuration)),
            QVReportingSafeFileComponent(owner->serviceName(), 64));
    }
    fullWriterPath_ = (directory / mOutputFile_).string();
    tempWriterPath_ = (directory / kTemporaryFileName).string();
    QVLOG_DEBUG(QVReportingTraceCategory(), "tempWriterPath: {}", tempWriterPath_);
    pathToGDJ_ = tempWriterPath_;

    auto opened = platform.gaugeData.open(pathToGDJ_, mGaugeDataName_, mResultsVersion_, 0);
    mWriter_ = std::move(opened.file);
    if (!mWriter_) {
        QVLOG_ERROR(QVReportingTraceCategory(), "Failed to open gaugedata writer. errno: {}",
                    opened.error);
    }
}

void QVReportingSessionTraceWorker::processProbe(const ThreadlineProbe& probe) {
    QVLOG_DEBUG(QVReportingTraceCategory(), "{}, {}", probe.name, probe.description);
    if (!probe.children.empty()) {
        for (const ThreadlineProbe& child : probe.children) {
            processProbe(child);
        }
        return;
    }
    if (!threadlineModel_) {
        return;
    }
    for (const ThreadlineEvent& event : probe.events) {
        const double seconds = threadlineModel_->secondsFromTimebase(event.duration);
        const double milliseconds = seconds * 1000.0;
        QVLOG_DEBUG(QVReportingTraceCategory(), "name:{} time:{:f} ms", event.name, milliseconds);
        if (mWriter_) {
            mWriter_->addValue(event.name, "milliseconds", milliseconds);
        }
    }
}

}  // namespace qv
