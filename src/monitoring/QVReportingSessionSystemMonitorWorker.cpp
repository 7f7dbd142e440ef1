#include "monitoring/QVReportingSessionSystemMonitorWorker.h"

#include <utility>

#include "monitoring/QVReportingSystemMonitor.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingVocabulary.h"

namespace qv {

std::shared_ptr<QVReportingSessionSystemMonitorWorker>
QVReportingSessionSystemMonitorWorker::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    auto dictionary = QVReportingSystemMonitor::getSystemMonitorDictionary();
    if (!dictionary) {
        return nullptr;
    }
    auto worker = std::make_shared<QVReportingSessionSystemMonitorWorker>();
    worker->setSession(session);
    worker->systemMonitorDictionary_ = std::move(dictionary);
    worker->featureKeys_ = QVReportingSystemMonitor::getSystemMonitorKeys();
    return worker;
}

QVReportingSessionSystemMonitorWorker::~QVReportingSessionSystemMonitorWorker() {
    removeObservers();
}

bool QVReportingSessionSystemMonitorWorker::start() {
    const std::weak_ptr<QVReportingSessionSystemMonitorWorker> weakSelf = weak_from_this();
    for (const std::string& key : featureKeys_) {
        handleChange(systemMonitorDictionary_->valueForKey(key));
        observers_.push_back(
            systemMonitorDictionary_->addObserver(key, [weakSelf](const Dictionary& newValue) {
                if (auto self = weakSelf.lock()) {
                    self->handleChange(newValue);
                }
            }));
    }
    return true;
}

void QVReportingSessionSystemMonitorWorker::stop() {
    removeObservers();
}

void QVReportingSessionSystemMonitorWorker::removeObservers() {
    if (!systemMonitorDictionary_) {
        return;
    }
    for (const auto id : observers_) {
        systemMonitorDictionary_->removeObserver(id);
    }
    observers_.clear();
}

std::shared_ptr<QVReportingSessionMessage> QVReportingSessionSystemMonitorWorker::messageForState(
    const std::optional<Dictionary>& state) {
    auto message = QVReportingSessionMessage::initWithMessage(state.value_or(Dictionary{}),
                                                              category::kSetup, type::kSetup);
    Dictionary& payload = message->message();
    if (const Value* readTime = payload.find(QVReportingInternalEventEpochTime)) {
        payload.set(QVReportingMessageKeyLastUpdated, *readTime);
        payload.erase(QVReportingInternalEventEpochTime);
        payload.erase(QVReportingInternalEventSystemUptimeSec);
    }
    return payload.empty() ? nullptr : message;
}

void QVReportingSessionSystemMonitorWorker::handleChange(const std::optional<Dictionary>& state) {
    auto message = messageForState(state);
    if (!message) {
        return;
    }
    if (auto session = this->session()) {
        session->sendMessage(message);
    }
}

}  // namespace qv
