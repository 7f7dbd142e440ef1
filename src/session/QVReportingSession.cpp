#include "session/QVReportingSession.h"

#include <algorithm>
#include <cmath>
#include <cstring>

#include "platform/Clock.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingStats.h"
#include "session/QVReportingWorkerRegistry.h"

namespace qv {

namespace {

const char* yesNo(bool b) {
    return b ? "YES" : "NO";
}

// The keys every message is stamped with, made once: a key compares by pointer and carries its
// hash, so looking these up per message costs no hashing.
struct StampKeys {
    const DictionaryKey timestamp{QVReportingInternalEventEpochTime};
    const DictionaryKey processUptime{QVReportingInternalEventProcessUptimeMS};
    const DictionaryKey systemUptime{QVReportingInternalEventSystemUptimeSec};
    const DictionaryKey invalidTimestamp{QVReportingMessageKeyInvalidTimestamp};
    const DictionaryKey audioTag{QVReportingMessageKeyAudioTag};
    const DictionaryKey applicationName{QVReportingApplicationName};
};

const StampKeys kStampKeys;

const StampKeys& keys() {
    return kStampKeys;
}

// Keys that change with every message of an unchanged state, so redundancy ignores them.
inline bool ignoredByRedundancy(const DictionaryKey& key) {
    const StampKeys& k = keys();
    if (key.isInterned()) {  // the usual case: three pointer comparisons
        const void* id = key.identity();
        return id == k.timestamp.identity() || id == k.processUptime.identity() ||
               id == k.systemUptime.identity();
    }
    return key == k.processUptime || key == k.systemUptime || key == k.timestamp;
}

std::size_t countCompared(const Dictionary& d) {
    std::size_t n = 0;
    for (const auto& entry : d) {
        n += ignoredByRedundancy(entry.first) ? 0 : 1;
    }
    return n;
}

// A usable timestamp is a finite-or-infinite number held as a number; NaN, strings, booleans and
// containers are not times.
std::optional<double> timestampOf(const Value& v) {
    switch (v.kind()) {
        case Value::Kind::Int:
        case Value::Kind::UInt:
        case Value::Kind::Double: {
            const double d = *v.asDouble();
            return std::isnan(d) ? std::nullopt : std::optional<double>(d);
        }
        default:
            return std::nullopt;
    }
}

// Estimated memory of one stored message: the message in its shared block, its place in the
// list, and its payload.
std::size_t storedMessageBytes(const QVReportingSessionMessage& message) {
    constexpr std::size_t kSharedBlock = sizeof(QVReportingSessionMessage) + 32;
    return kSharedBlock + sizeof(std::shared_ptr<QVReportingSessionMessage>) +
           message.message().approximateHeapBytes();
}

// The workers of the given lists in list order, each once, at its first place.
template <typename... Lists>
QVReportingSession::WorkerList orderedUnion(const Lists&... lists) {
    QVReportingSession::WorkerList order;
    auto add = [&order](const auto& list) {
        for (const auto& w : list) {
            std::shared_ptr<QVReportingSessionWorkerProtocol> worker = w;
            if (std::find(order.begin(), order.end(), worker) == order.end()) {
                order.push_back(std::move(worker));
            }
        }
    };
    (add(lists), ...);
    return order;
}

}  // namespace

QVReportingSession::QVReportingSession(const Platform& platform, ReporterID reporterID,
                                       std::vector<std::int64_t> processIdentifiers)
    : platform_(platform),
      reporterID_(reporterID),
      processIdentifiers_(std::move(processIdentifiers)) {}

std::shared_ptr<QVReportingSession> QVReportingSession::initWithID(
    const Platform& platform, ReporterID reporterID, std::vector<std::int64_t> processIdentifiers) {
    const QVReportingWorkerRegistry& registry = QVReportingWorkerRegistry::shared();
    std::shared_ptr<QVReportingSession> session(
        new QVReportingSession(platform, reporterID, std::move(processIdentifiers)));
    session->startWorkersFromClasses(registry.startOnInitWorkerClasses());
    QVLOG_INFO(QVReportingSessionCategory(), "created reporting session for ID: {}", reporterID);
    return session;
}

QVReportingSession::~QVReportingSession() {
    releaseStore();
    QVLOG_INFO(QVReportingSessionCategory(), "deallocing this session {}", reporterID_);
}

const std::vector<const QVReportingWorkerClass*>& QVReportingSession::getAllWorkerClasses() {
    return QVReportingWorkerRegistry::shared().allWorkerClasses();
}

void QVReportingSession::setServiceType(AudioServiceType serviceType) {
    serviceType_ = serviceType;
    serviceName_ = std::string(QVReportingUtilityGenerateServiceNameFromServiceType(serviceType));
    QVLOG_INFO(QVReportingSessionCategory(), "setting service type {}", serviceName_);
}

void QVReportingSession::updateConfigurationWithContentsOfConfiguration(
    const Dictionary* configuration) {
    if (configuration == nullptr) {
        return;
    }
    if (const Value* display = configuration->find(QVReportingMessageKXHostApplicationDisplayID)) {
        configuration_.set(QVReportingApplicationName, *display);
    }
    configuration_.merge(*configuration);
}

std::string QVReportingSession::description() const {
    const Value* display = configuration_.find(QVReportingApplicationName);
    return fmt::format(
        "reporterID={},serviceName={},ownerPid={},clientProcessName={},"
        "HostApplicationDisplayID={},started={},singleMessageSession={}",
        reporterID_, serviceName_, processIdentifiers_.empty() ? 0 : processIdentifiers_.front(),
        clientProcessName_.empty() ? "(null)" : clientProcessName_,
        display ? display->description() : "(null)", started_ ? 1 : 0,
        isSingleMessageSession_ ? 1 : 0);
}

// ---- stamping ----

double QVReportingSession::getEpochTimeFromQVReportingStateMessage(
    const QVReportingSessionMessage& message) {
    const Value* t = message.message().find(keys().timestamp);
    return t ? t->doubleValue() : 0.0;
}

void QVReportingSession::addMissingDates(QVReportingSessionMessage& message, const Clock& clock) {
    Dictionary& payload = message.message();
    const double now = clock.now();
    const StampKeys& k = keys();
    if (Value* stamp = payload.find(k.timestamp)) {
        const auto t = timestampOf(*stamp);
        // Future times are accepted as they are; only stale or unreadable ones are replaced.
        if (!t || *t < now - kMaximumTimestampAge) {
            Value rejected = std::move(*stamp);
            *stamp = now;
            payload.set(k.invalidTimestamp, std::move(rejected));
        }
        return;
    }
    payload.set(k.invalidTimestamp, "nil");
    payload.set(k.timestamp, now);
}

void QVReportingSession::removeWhiteSpaceFromKeys(QVReportingSessionMessage& message) {
    Dictionary& payload = message.message();
    std::vector<std::string> blankKeys;
    for (const auto& entry : payload) {
        if (entry.first.hasBlank()) {
            blankKeys.push_back(entry.first);
        }
    }
    if (blankKeys.empty()) {
        return;
    }
    for (const std::string& key : blankKeys) {
        std::string cleaned = key;
        std::replace(cleaned.begin(), cleaned.end(), ' ', '_');
        // The blank form wins over a "_" form the payload already held.
        payload.set(cleaned, *payload.find(key));
    }
    for (const std::string& key : blankKeys) {
        payload.erase(key);
    }
}

void QVReportingSession::addAudioMessageTag(QVReportingSessionMessage& message) {
    std::string tag = QVReportingUtilityCategoryString(message.category());
    tag += QVReportingUtilityTypeString(message.type());
    message.message().set(keys().audioTag, std::move(tag));
}

void QVReportingSession::addAppName(QVReportingSessionMessage& message) const {
    Dictionary& payload = message.message();
    const DictionaryKey& key = keys().applicationName;
    Value* name = payload.find(key);
    if (name && !(name->isString() && *name->asString() == "Unknown")) {
        return;
    }
    const Value* configured = configuration_.find(key);
    Value chosen = configured ? *configured : Value("Unknown");
    if (name) {
        *name = std::move(chosen);
    } else {
        payload.set(key, std::move(chosen));
    }
}

// ---- intake ----

bool QVReportingSession::messageIsRedundant(const QVReportingSessionMessage& message) const {
    if (message.type() == type::kError || message.category() == category::kError) {
        return false;
    }
    const auto it = newestByKind_.find(kindKey(message.category(), message.type()));
    if (it == newestByKind_.end()) {
        return false;
    }
    const Dictionary& current = message.message();
    const Dictionary& previous = it->second->message();
    if (countCompared(current) != countCompared(previous)) {
        return false;
    }
    std::size_t position = 0;  // messages of one kind usually hold their keys in one order
    for (const auto& [key, value] : current) {
        const std::size_t at = position++;
        if (ignoredByRedundancy(key)) {
            continue;
        }
        const Value* other = previous.findNear(key, at);
        if (!other || *other != value) {
            return false;
        }
    }
    QVLOG_DEBUG(QVReportingSessionCategory(), "marking event redundant");
    return true;
}

void QVReportingSession::storeMessage(std::shared_ptr<QVReportingSessionMessage> message) {
    const std::size_t bytes = storedMessageBytes(*message);
    QVReportingStats::shared().forceStoreBytes(bytes);
    storedBytes_ += bytes;
    newestByKind_[kindKey(message->category(), message->type())] = message.get();
    messages_.push_back(std::move(message));
}

void QVReportingSession::storeIfBudgetAllows(
    const std::shared_ptr<QVReportingSessionMessage>& message) {
    const std::size_t bytes = storedMessageBytes(*message);
    if (!QVReportingStats::shared().reserveStoreBytes(storedBytes_, bytes)) {
        QVReportingStats::shared().noteMessageNotStored();
        if (messagesNotStored_++ == 0) {
            QVLOG_ERROR(QVReportingSessionCategory(),
                        "store budget used up: session {} holds {} bytes in {} messages (the "
                        "daemon {} bytes); further messages of this run are forwarded but not "
                        "stored",
                        reporterID_, storedBytes_, messages_.size(),
                        QVReportingStats::shared().storeBytes());
        }
        return;
    }
    storedBytes_ += bytes;
    newestByKind_[kindKey(message->category(), message->type())] = message.get();
    messages_.push_back(message);
}

void QVReportingSession::rememberPreviousValues(const Dictionary& payload) {
    constexpr std::size_t kMaxKeys = QVReportingStats::kMaxPreviousValuesKeys;
    if (previousValues_.size() + payload.size() <= kMaxKeys) {
        previousValues_.merge(payload);
        return;
    }
    std::size_t dropped = 0;
    for (const auto& [key, value] : payload) {
        if (Value* known = previousValues_.find(key)) {
            *known = value;
        } else if (previousValues_.size() < kMaxKeys) {
            previousValues_.set(key, value);
        } else {
            ++dropped;
            QVReportingStats::shared().notePreviousValueDropped();
        }
    }
    if (dropped > 0 && !warnedPreviousValues_) {
        warnedPreviousValues_ = true;
        QVLOG_ERROR(QVReportingSessionCategory(),
                    "session {} remembers {} distinct keys; new keys are no longer remembered",
                    reporterID_, previousValues_.size());
    }
}

void QVReportingSession::releaseStore() {
    QVReportingStats::shared().releaseStoreBytes(storedBytes_);
    storedBytes_ = 0;
}

void QVReportingSession::rebuildNewestIndex() {
    newestByKind_.clear();
    for (const auto& m : messages_) {
        newestByKind_[kindKey(m->category(), m->type())] = m.get();
    }
}

void QVReportingSession::sendMessage(const std::shared_ptr<QVReportingSessionMessage>& message,
                                     const Reply& reply) {
    ++totalMessageCount_;
    addMissingDates(*message, platform_.clock);
    removeWhiteSpaceFromKeys(*message);
    addAudioMessageTag(*message);
    addAppName(*message);
    // Receipt trace point: no tracing facility is wired up on Linux.
    message->setIsSessionStarted(started_);
    message->setIsRedundant(messageIsRedundant(*message));
    QVLOG_DEBUG(
        QVReportingSessionCategory(),
        "QVReportingSessionWorker action=sendMessage reporterID={} app={} redundant={} "
        "message={}",
        reporterID_,
        [&] {
            const Value* app = message->message().find(QVReportingApplicationName);
            return app ? app->description() : std::string("(null)");
        }(),
        yesNo(message->isRedundant()), message->description());
    rememberPreviousValues(message->message());
    if (!message->isRedundant()) {
        storeIfBudgetAllows(message);
    }
    offerToConsumers(message);
    if (reply) {
        reply();
    }
}

void QVReportingSession::offerToConsumers(
    const std::shared_ptr<QVReportingSessionMessage>& message) {
    const auto& destinations = message->destinationWorkers();
    // By index: a worker may add messages (and so, in principle, workers) while it handles one.
    for (std::size_t i = 0; i < consumingMessageWorkers_.size(); ++i) {
        const auto worker = consumingMessageWorkers_[i];
        if (!worker->started()) {
            continue;
        }
        if (message->isRedundant() && !worker->handleRedundantMessages()) {
            continue;
        }
        if (!destinations.empty() && std::find(destinations.begin(), destinations.end(),
                                               worker->workerClass()) == destinations.end()) {
            continue;
        }
        worker->handleMessage(message);
        QVLOG_DEBUG(QVReportingSessionCategory(),
                    "QVReportingSessionWorker action=handleMessage worker={} reporterID={}",
                    worker->workerClass()->name, reporterID_);
    }
}

// ---- lifecycle ----

std::shared_ptr<QVReportingSessionMessage> QVReportingSession::makeStateMessage(
    bool starting) const {
    const auto count = messages_.size();
    Dictionary payload;
    payload.reserve(9);
    payload.set("method", starting ? "start" : "stop");
    payload.set(starting ? "messages_at_start" : "messages_at_stop",
                static_cast<std::int64_t>(count));
    // The same number again: redundant messages are never stored.
    payload.set(starting ? "unique_messages_at_start" : "unique_messages_at_stop",
                static_cast<std::uint64_t>(count));
    payload.set("reporterid", reporterID_);
    payload.set(starting ? "running_at_start" : "running_at_stop", yesNo(started_));
    auto message = std::make_shared<QVReportingSessionMessage>(
        std::move(payload), category::kSetup, starting ? type::kStart : type::kStop);
    addMissingDates(*message, platform_.clock);
    addAudioMessageTag(*message);
    return message;
}

void QVReportingSession::start() {
    storeMessage(makeStateMessage(/*starting=*/true));
    QVLOG_INFO(QVReportingSessionCategory(), "start called. reporterID={}", reporterID_);
    if (started_) {
        QVLOG_INFO(QVReportingSessionCategory(), "{} is already started", reporterID_);
        return;
    }
    QVLOG_DEBUG(QVReportingSessionCategory(), "self.started==false. starting. reporterID={}",
                reporterID_);
    started_ = true;
    startWorkersFromClasses(QVReportingWorkerRegistry::shared().usableWorkerClasses());
}

void QVReportingSession::stop() {
    storeMessage(makeStateMessage(/*starting=*/false));
    QVLOG_DEBUG(QVReportingSessionCategory(), "stop called. reporterID={}", reporterID_);
    if (!started_) {
        return;
    }
    QVLOG_INFO(QVReportingSessionCategory(), "ending session. reporterID={}", reporterID_);
    QVReportingSessionMessage::sortMessages(messages_);
    rebuildNewestIndex();

    // Producers first, so the messages they derive still reach running consumers.
    const WorkerList order =
        orderedUnion(producingMessageWorkers_, consumingMessageWorkers_, messageWorkers_);
    for (const auto& worker : order) {
        if (!worker->started()) {
            continue;
        }
        worker->stop();
        worker->setStarted(false);
        QVLOG_DEBUG(QVReportingSessionCategory(),
                    "QVReportingSessionWorker action=stop worker={} reporterID={}",
                    worker->workerClass()->name, reporterID_);
    }
    messages_.clear();
    releaseStore();
    newestByKind_.clear();
    totalMessageCount_ = 0;
    messagesNotStored_ = 0;
    started_ = false;
}

void QVReportingSession::startWorkersFromClasses(
    const std::vector<const QVReportingWorkerClass*>& classes) {
    const auto& log = QVReportingSessionCategory();
    for (const QVReportingWorkerClass* cls : classes) {
        if (isSingleMessageSession_ && !cls->handleSingleMessageSession) {
            QVLOG_DEBUG(log,
                        "Skipping QVReportingSessionWorker for single message session. "
                        "action=skipped worker={} reporterID={}",
                        cls->name, reporterID_);
            continue;
        }
        if (std::find(initializedWorkerClasses_.begin(), initializedWorkerClasses_.end(), cls) !=
            initializedWorkerClasses_.end()) {
            QVLOG_DEBUG(log,
                        "QVReportingSessionWorker already initialized. action=skipped worker={} "
                        "reporterID={}",
                        cls->name, reporterID_);
            continue;
        }
        QVLOG_DEBUG(log,
                    "Initializing QVReportingSessionWorker. action=init worker={} reporterID={}",
                    cls->name, reporterID_);
        auto worker = cls->initWithSession ? cls->initWithSession(shared_from_this()) : nullptr;
        if (!worker) {
            QVLOG_DEBUG(log,
                        "QVReportingSessionWorker failed to initialize. action=failure worker={} "
                        "reporterID={}",
                        cls->name, reporterID_);
            continue;
        }
        worker->setWorkerClass(cls);
        initializedWorkerClasses_.push_back(cls);
        messageWorkers_.push_back(worker);
        if (cls->isConsumer) {
            consumingMessageWorkers_.push_back(
                std::dynamic_pointer_cast<QVReportingSessionWorkerConsumerProtocol>(worker));
        }
        if (cls->isProducer) {
            producingMessageWorkers_.push_back(worker);
        }
        QVLOG_DEBUG(log, "QVReportingSessionWorker action=added worker={} reporterID={}", cls->name,
                    reporterID_);
    }

    // Consumers first, so nothing a producer sends on start misses them.
    const WorkerList order =
        orderedUnion(consumingMessageWorkers_, producingMessageWorkers_, messageWorkers_);
    for (const auto& worker : order) {
        if (worker->started()) {
            continue;
        }
        if (worker->workerClass()->implementsStart) {
            worker->setStarted(worker->start());
            QVLOG_DEBUG(log,
                        "QVReportingSessionWorker action=start worker={} started={} "
                        "reporterID={}",
                        worker->workerClass()->name, yesNo(worker->started()), reporterID_);
        } else {
            worker->setStarted(true);
        }
    }
}

}  // namespace qv
