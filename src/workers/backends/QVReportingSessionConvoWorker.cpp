#include "workers/backends/QVReportingSessionConvoWorker.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstdlib>
#include <utility>

#include "platform/ConvoService.h"
#include "platform/Platform.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingStats.h"
#include "session/QVReportingUtility.h"

namespace qv {

namespace {

// The task names the log lines carry.
constexpr std::string_view kStartTask = "-[QVReportingSessionConvoWorker start]_block_invoke";
constexpr std::string_view kForwardTask =
    "-[QVReportingSessionConvoWorker handleMessage:]_block_invoke";
constexpr std::string_view kSendMessage = "-[QVReportingSessionConvoWorker _sendMessage:]";
constexpr std::string_view kStopTask = "-[QVReportingSessionConvoWorker stop]_block_invoke";

// Room left in a forwarded message's payload, as in every message, for keys stamped later.
constexpr std::size_t kStampedKeyRoom = 4;

// The sink a message dropped before it reached the Convo service is counted against.
constexpr std::string_view kConvoSinkName = "convo";

// The reporting version as the service takes it: the float value of the version text.
float clientVersion() {
    static const float version =
        std::strtof(std::string(QVReportingVersionNumber).c_str(), nullptr);
    return version;
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
        convoReportingQueue_ = std::make_unique<PooledSerialQueue>(
            std::string(kQueueName), executor_, PooledSerialQueue::kUnbounded,
            kForwardingGatherDelay);
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
    outbox_.reset();  // later messages follow the start
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
    if (heldMessages_.load(std::memory_order_relaxed) >= kMaxHeldMessages) {
        QVReportingStats::shared().noteSinkLineLost(kConvoSinkName);
        return;
    }
    ++heldMessages_;
    if (outbox_) {
        std::lock_guard lock(outbox_->mutex);
        if (!outbox_->taken) {
            outbox_->payloads.append(message->message());
            outbox_->kinds.emplace_back(message->category(), message->type());
            ++outboxSize_;
            return;
        }
    }
    // No open outbox: a new one, with room for as many messages as the last one took, and the
    // task that will take it.
    outbox_ = std::make_shared<Outbox>();
    constexpr std::size_t kMaxReserved = 256;  // a backlog's outbox is no measure of the next
    const std::size_t room = std::min(outboxSize_, kMaxReserved);
    outbox_->payloads.reserveFor(room, message->message());
    outbox_->kinds.reserve(room);
    outboxSize_ = 1;
    outbox_->payloads.append(message->message());
    outbox_->kinds.emplace_back(message->category(), message->type());
    convoReportingQueue().tryAsync(
        [self = shared_from_this(), outbox = outbox_] { self->forwardTask(*outbox); });
}

void QVReportingSessionConvoWorker::stop() {
    // The session empties its list once its workers have stopped, and workers that stop later may
    // still write the stored messages, so the summary is made of copies taken now: the values of
    // the messages it folds in (not redundant, sent while the session ran, and not addressed only
    // to other workers). An empty list is told apart, as it sends no summary at all.
    const auto owner = session();
    // A customer build sends the summary without its time stamps: unless the debug lines show
    // them, they are not even collected.
    const bool timesUnseen = !internalBuild_ && !logEnabled(LogLevel::Debug);
    QVReportingConvoSessionSummary summary(
        owner ? owner->serviceType() : service::kUnknown,
        timesUnseen ? QVReportingMessageKeyQVTimestamp : std::string_view());
    bool listWasEmpty = true;
    ReporterID reporterID = 0;
    if (owner) {
        const QVReportingWorkerClass* const self =
            &makeWorkerClass<QVReportingSessionConvoWorker>();
        listWasEmpty = owner->messages().empty();
        reporterID = owner->reporterID();
        for (const auto& m : owner->messages()) {
            const auto& destinations = m->destinationWorkers();
            if (m->isRedundant() || !m->isSessionStarted() ||
                (!destinations.empty() &&
                 std::find(destinations.begin(), destinations.end(), self) == destinations.end())) {
                continue;
            }
            summary.add(m->message());
        }
    }
    outbox_.reset();  // later messages follow the stop
    convoReportingQueue().async(
        [self = shared_from_this(), summary = std::move(summary), listWasEmpty, reporterID] {
            self->stopTask(summary, listWasEmpty, reporterID);
        });
}

// ---- on the Convo queue ----

void QVReportingSessionConvoWorker::startTask(const StartArguments& arguments) {
    const auto& log = QVReportingSessionConvoReportingCategory();
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
                QVLOG_DEFAULT(QVReportingSessionConvoReportingCategory(), "list of backends {}",
                              describeBackends(*backends));
                backend->convoReportingSessionStarted.store(true);
                if (const auto self = weakSelf.lock()) {
                    self->setStarted(true);
                }
            } else {
                QVLOG_ERROR(QVReportingSessionConvoReportingCategory(),
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
    const auto& log = QVReportingSessionConvoReportingCategory();
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

void QVReportingSessionConvoWorker::forwardTask(Outbox& outbox) {
    FrozenPayloads payloads;
    std::vector<std::pair<AudioEventCategory, AudioEventType>> kinds;
    {
        std::lock_guard lock(outbox.mutex);
        outbox.taken = true;
        payloads = std::move(outbox.payloads);
        kinds = std::move(outbox.kinds);
    }
    heldMessages_ -= kinds.size();
    for (std::size_t i = 0; i < kinds.size(); ++i) {
        if (backend_->convoReportingSessionStarted.load()) {
            QVReportingSessionMessage message(payloads.thaw(i, kStampedKeyRoom), kinds[i].first,
                                              kinds[i].second);
            _sendMessage(message);
        } else {
            QVLOG_DEFAULT(QVReportingSessionConvoReportingCategory(), "Session never started. {}",
                          kForwardTask);
        }
    }
}

void QVReportingSessionConvoWorker::_sendMessage(QVReportingSessionMessage& message) {
    const auto& log = QVReportingSessionConvoReportingCategory();
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

void QVReportingSessionConvoWorker::stopTask(const QVReportingConvoSessionSummary& summary,
                                             bool listWasEmpty, ReporterID reporterID) {
    const auto& log = QVReportingSessionConvoReportingCategory();
    if (!backend_->convoReportingSessionStarted.load()) {
        QVLOG_DEFAULT(log, "Session never started. {}", kStopTask);
        return;
    }
    if (!listWasEmpty) {
        Dictionary payload = summary.joined();
        QVLOG_DEFAULT(log, "sending convo summary event. reporterID={}", reporterID);
        if (logEnabled(LogLevel::Debug)) {
            for (const auto& [key, joined] : payload) {
                QVLOG_DEBUG(log, "sending convo summary event. reporterID={} {}=\"{}\"", reporterID,
                            key, *joined.asString());
            }
        }
        QVReportingSessionMessage event(std::move(payload), category::kUnknown, type::kUnknown);
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

}  // namespace qv
