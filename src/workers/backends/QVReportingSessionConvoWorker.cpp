#include "workers/backends/QVReportingSessionConvoWorker.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstdlib>
#include <iterator>
#include <unordered_map>
#include <utility>

#include "platform/ConvoService.h"
#include "platform/Platform.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingStats.h"
#include "session/QVReportingUtility.h"

namespace qv {

namespace {

const QVReportingLogCategory& logCategory() {
    return QVReportingSessionConvoReportingCategory();
}

// The task names the log lines carry.
constexpr std::string_view kStartTask = "-[QVReportingSessionConvoWorker start]_block_invoke";
constexpr std::string_view kForwardTask =
    "-[QVReportingSessionConvoWorker handleMessage:]_block_invoke";
constexpr std::string_view kSendMessage = "-[QVReportingSessionConvoWorker _sendMessage:]";
constexpr std::string_view kStopTask = "-[QVReportingSessionConvoWorker stop]_block_invoke";

// The sink a message dropped before it reached the Convo service is counted against.
constexpr std::string_view kConvoSinkName = "convo";

// The reporting version as the service takes it: the float value of the version text.
float clientVersion() {
    static const float version =
        std::strtof(std::string(QVReportingVersionNumber).c_str(), nullptr);
    return version;
}

// Appends what "%@" prints for v: a string as it is, anything else by its description. The
// scalar kinds are written in place (the summary of a long session prints millions of them);
// they print exactly as Value::description() does.
void appendDescription(std::string& out, const Value& v) {
    switch (v.kind()) {
        case Value::Kind::String:
            out += *v.asString();
            return;
        case Value::Kind::Int:
            fmt::format_to(std::back_inserter(out), "{}", *v.asInt64());
            return;
        case Value::Kind::UInt:
            fmt::format_to(std::back_inserter(out), "{}", *v.asUInt64());
            return;
        case Value::Kind::Double:
            fmt::format_to(std::back_inserter(out), "{}", *v.asDouble());
            return;
        case Value::Kind::Bool:
            out += v.boolValue() ? '1' : '0';
            return;
        default:
            out += v.description();
            return;
    }
}

std::string describeBackends(const std::vector<std::string>& backends) {
    Array list;
    list.reserve(backends.size());
    for (const auto& name : backends) {
        list.emplace_back(name);
    }
    return Value(std::move(list)).description();
}

}  // namespace

QVReportingSessionConvoWorker::QVReportingSessionConvoWorker(ConvoService& convo,
                                                             TaskExecutor& executor,
                                                             bool internalBuild)
    : convo_(convo),
      executor_(executor),
      internalBuild_(internalBuild),
      backend_(std::make_shared<Backend>(executor)) {}

QVReportingSessionConvoWorker::~QVReportingSessionConvoWorker() = default;

std::shared_ptr<QVReportingSessionConvoWorker> QVReportingSessionConvoWorker::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    if (!session || session->serviceType() == service::kTest) {
        return nullptr;
    }
    const Platform& platform = session->platform();
    auto worker = std::make_shared<QVReportingSessionConvoWorker>(
        platform.convo, platform.executor, QVReportingUtilityIsInternalBuild(platform));
    worker->setSession(session);
    return worker;
}

PooledSerialQueue& QVReportingSessionConvoWorker::convoReportingQueue() {
    if (!convoReportingQueue_) {
        convoReportingQueue_ = std::make_unique<PooledSerialQueue>(std::string(kQueueName),
                                                                   executor_, kMaxHeldMessages);
    }
    return *convoReportingQueue_;
}

bool QVReportingSessionConvoWorker::getConvoReportingStartedState() const {
    return backend_->convoReportingSessionStarted.load();
}

std::uint16_t QVReportingSessionConvoWorker::retrieveConvoReportingCategoryFromCategory(
    AudioEventCategory category) {
    // Prefixed categories are sent by their base category, like plain ones.
    (void)QVReportingUtilityIsABTestModeOn(category);
    return static_cast<std::uint16_t>(category & 0xFFFFu);
}

bool QVReportingSessionConvoWorker::shouldBatchConvoReportingEventsForServiceType(
    AudioServiceType serviceType) {
    return serviceType != service::kAPIUsage;
}

// ---- on the session's queue ----

bool QVReportingSessionConvoWorker::start() {
    const auto owner = session();
    if (!owner || owner->serviceType() == service::kTest) {
        return false;
    }
    StartArguments arguments{owner->configuration(), owner->serviceName() + "_session",
                             owner->serviceType(), owner->reporterID(),
                             owner->isSingleMessageSession()};
    convoReportingQueue().async([self = shared_from_this(), arguments = std::move(arguments)] {
        self->startTask(arguments);
    });
    return true;
}

void QVReportingSessionConvoWorker::handleMessage(
    const std::shared_ptr<QVReportingSessionMessage>& message) {
    if (!message) {
        return;
    }
    auto copy = std::make_shared<QVReportingSessionMessage>(message->message(), message->category(),
                                                            message->type());
    const bool queued = convoReportingQueue().tryAsync(
        [self = shared_from_this(), copy = std::move(copy)] { self->forwardTask(*copy); });
    if (!queued) {
        QVReportingStats::shared().noteSinkLineLost(kConvoSinkName);
    }
}

void QVReportingSessionConvoWorker::stop() {
    // The session empties its list after its workers stop, and later workers may still write the
    // stored messages, so the summary works on copies taken now. Messages the summary skips
    // (redundant, not sent while the session ran, or addressed only to other workers) are left
    // out of the copy; an empty list is told apart, as it sends no summary at all.
    std::vector<Dictionary> kept;
    bool listWasEmpty = true;
    AudioServiceType serviceType = service::kUnknown;
    ReporterID reporterID = 0;
    if (const auto owner = session()) {
        const QVReportingWorkerClass* const self =
            &makeWorkerClass<QVReportingSessionConvoWorker>();
        const auto& messages = owner->messages();
        listWasEmpty = messages.empty();
        kept.reserve(messages.size());
        for (const auto& m : messages) {
            const auto& destinations = m->destinationWorkers();
            if (m->isRedundant() || !m->isSessionStarted() ||
                (!destinations.empty() &&
                 std::find(destinations.begin(), destinations.end(), self) == destinations.end())) {
                continue;
            }
            kept.push_back(m->message());
        }
        serviceType = owner->serviceType();
        reporterID = owner->reporterID();
    }
    convoReportingQueue().async(
        [self = shared_from_this(), kept = std::move(kept), listWasEmpty, serviceType, reporterID] {
            self->stopTask(kept, listWasEmpty, serviceType, reporterID);
        });
}

// ---- on the Convo queue ----

void QVReportingSessionConvoWorker::startTask(const StartArguments& arguments) {
    const auto& log = logCategory();
    QVLOG_DEBUG(log, "entering convoreporting {}", kStartTask);
    convoReportingAgentToken_ = convo_.newHierarchyTokenFromParentToken(std::nullopt);
    if (!convoReportingAgentToken_) {
        QVLOG_ERROR(log,
                    "newHierarchyTokenFromParentToken returned nil. Will skip convo for this "
                    "session. {}",
                    kStartTask);
        return;
    }
    const bool batch = shouldBatchConvoReportingEventsForServiceType(arguments.serviceType);

    Dictionary sessionInfo;
    sessionInfo.reserve(7);
    sessionInfo.set(convo::kSessionInfoClientType, kClientType);
    sessionInfo.set(convo::kSessionInfoClientVersion, clientVersion());
    sessionInfo.set(convo::kSessionInfoSessionID, arguments.reporterID);
    sessionInfo.set(convo::kSessionInfoBatchEvent, batch);
    sessionInfo.set(convo::kSessionInfoHierarchyToken, *convoReportingAgentToken_);
    sessionInfo.set(convo::kSessionInfoContainsRealtimeEvents, !batch);

    Dictionary userInfo;
    userInfo.reserve(3 + arguments.configuration.size());
    userInfo.set(convo::kUserInfoClientName, QVReportingClientNameQVSound);
    userInfo.set(kUserInfoSessionIDKey, arguments.reporterID);
    userInfo.set(convo::kUserInfoServiceName, arguments.serviceSessionName);
    if (internalBuild_) {
        userInfo.set(kUserInfoSessionIDKey, arguments.reporterID);
    }
    if (arguments.isSingleMessageSession) {
        userInfo.set(convo::kUserInfoServiceName,
                     QVReportingUtilityGenerateServiceNameFromServiceType(arguments.serviceType));
    }
    if (!arguments.configuration.empty()) {
        userInfo.merge(arguments.configuration);
    }
    if (const Value* app = arguments.configuration.find(QVReportingApplicationName)) {
        sessionInfo.set(convo::kSessionInfoClientBundleID, *app);
    }

    convoReportingSession_ = convo_.createSession(sessionInfo, userInfo, std::nullopt);
    // The completion may come on any thread, and after this worker is gone: it touches only what
    // it holds.
    convoReportingSession_->startConfiguration(
        [backend = backend_,
         weakSelf = weak_from_this()](const std::optional<std::vector<std::string>>& backends) {
            if (backends) {
                QVLOG_DEFAULT(logCategory(), "list of backends {}", describeBackends(*backends));
                backend->convoReportingSessionStarted.store(true);
                if (const auto self = weakSelf.lock()) {
                    self->setStarted(true);
                }
            } else {
                QVLOG_ERROR(logCategory(),
                            "no backends found, this session won't get sent to the server");
                backend->convoReportingSessionStarted.store(false);
            }
            backend->convoreportingBackendSemaphore.signal();
        });
    QVLOG_DEFAULT(log, "waiting to find backends");
    convoReportingQueue_->waitThen(
        backend_->convoreportingBackendSemaphore, kBackendWait,
        [self = shared_from_this()](bool signalled) { self->finishBackendWait(signalled); });
}

void QVReportingSessionConvoWorker::finishBackendWait(bool signalled) {
    const auto& log = logCategory();
    if (!signalled) {
        QVLOG_ERROR(log, "timed out waiting for backends");
    } else if (backend_->convoReportingSessionStarted.load()) {
        QVLOG_DEFAULT(log, "continuing with backends!");
        return;
    } else {
        QVLOG_ERROR(log, "failed to find backend");
    }
    convoReportingSession_.reset();
    convoReportingAgentToken_.reset();
}

void QVReportingSessionConvoWorker::forwardTask(QVReportingSessionMessage& message) {
    if (backend_->convoReportingSessionStarted.load()) {
        _sendMessage(message);
    } else {
        QVLOG_DEFAULT(logCategory(), "Session never started. {}", kForwardTask);
    }
}

void QVReportingSessionConvoWorker::_sendMessage(QVReportingSessionMessage& message) {
    const auto& log = logCategory();
    QVLOG_DEBUG(log, "entering convoreporting {}", kSendMessage);
    const std::uint16_t category = retrieveConvoReportingCategoryFromCategory(message.category());
    if (!internalBuild_) {
        message.message().erase(QVReportingMessageKeyQVTimestamp);
    }
    if (!convoReportingSession_) {
        return;
    }
    const auto error =
        convoReportingSession_->sendMessage(category, message.type(), message.message());
    if (!error) {
        QVLOG_DEBUG(log, "ConvoReportingAgent {} : message {} : category {} : type {}",
                    convoReportingSession_->description(), message.message().description(),
                    static_cast<std::int32_t>(message.category()),
                    static_cast<int>(message.type()));
    } else {
        QVLOG_ERROR(log, "error sending message {}", *error);
    }
}

void QVReportingSessionConvoWorker::stopTask(const std::vector<Dictionary>& kept, bool listWasEmpty,
                                             AudioServiceType serviceType, ReporterID reporterID) {
    const auto& log = logCategory();
    if (!backend_->convoReportingSessionStarted.load()) {
        QVLOG_DEFAULT(log, "Session never started. {}", kStopTask);
        return;
    }
    if (!listWasEmpty) {
        Dictionary summary = summaryPayload(kept, serviceType);
        QVLOG_DEFAULT(log, "sending convo summary event. reporterID={}", reporterID);
        if (logEnabled(LogLevel::Debug)) {
            for (const auto& [key, joined] : summary) {
                QVLOG_DEBUG(log, "sending convo summary event. reporterID={} {}=\"{}\"", reporterID,
                            key, *joined.asString());
            }
        }
        QVReportingSessionMessage event(std::move(summary), category::kUnknown, type::kUnknown);
        _sendMessage(event);
    }
    QVLOG_DEBUG(log, "entering convoreporting {}", kStopTask);
    if (convoReportingSession_) {
        convoReportingSession_->flush();
    }
    convoReportingSession_.reset();
    convoReportingAgentToken_.reset();
    backend_->convoReportingSessionStarted.store(false);
    QVLOG_DEBUG(log, "stopping and setting session to nil");
}

Dictionary QVReportingSessionConvoWorker::summaryPayload(const std::vector<Dictionary>& kept,
                                                         AudioServiceType serviceType) {
    // One column per key, in the order keys first appear; each holds its values' texts already
    // joined, and how many there are. Messages of one kind list their keys in the same order, so
    // the column of the key at the same place in the previous message is tried before the index.
    struct Column {
        std::string_view key;
        std::string joined;
        std::size_t count = 0;
    };
    std::vector<Column> columns;
    std::unordered_map<std::string_view, std::size_t> index;
    columns.push_back({kSummaryEventKey, fmt::to_string(serviceType), 1});
    index.emplace(kSummaryEventKey, 0);
    std::vector<std::size_t> byPosition;

    for (const Dictionary& payload : kept) {
        std::size_t position = 0;
        for (const auto& [key, value] : payload) {
            std::size_t at;
            if (position < byPosition.size() && columns[byPosition[position]].key == key) {
                at = byPosition[position];
            } else {
                const auto [it, added] = index.try_emplace(key, columns.size());
                if (added) {
                    columns.push_back({key, {}, 0});
                }
                at = it->second;
                if (position < byPosition.size()) {
                    byPosition[position] = at;
                } else {
                    byPosition.push_back(at);
                }
            }
            Column& column = columns[at];
            if (column.count++ > 0) {
                column.joined += ',';
            }
            appendDescription(column.joined, value);
            ++position;
        }
    }

    Dictionary summary;
    summary.reserve(columns.size());
    for (Column& column : columns) {
        summary.set(column.key, std::move(column.joined));
    }
    return summary;
}

}  // namespace qv
