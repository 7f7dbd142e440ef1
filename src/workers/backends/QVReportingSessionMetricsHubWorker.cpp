#include "workers/backends/QVReportingSessionMetricsHubWorker.h"

#include <fmt/format.h>

#include "platform/AnalyticsService.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingVocabulary.h"

namespace qv {

namespace {

std::string qvsoundEventName(const QVReportingSessionMessage& message) {
    return fmt::format("com.korvane.qvsound.{}.{}",
                       QVReportingUtilityCategoryString(message.category()),
                       QVReportingUtilityTypeString(message.type()));
}

std::string serviceEventName(std::string_view serviceName,
                             const QVReportingSessionMessage& message) {
    return fmt::format("com.korvane.{}.{}.{}", serviceName,
                       QVReportingUtilityCategoryString(message.category()),
                       QVReportingUtilityTypeString(message.type()));
}

}  // namespace

std::shared_ptr<QVReportingSessionMetricsHubWorker>
QVReportingSessionMetricsHubWorker::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    if (!session) {
        return nullptr;
    }
    auto worker =
        std::make_shared<QVReportingSessionMetricsHubWorker>(session->platform().analytics);
    worker->setSession(session);
    return worker;
}

void QVReportingSessionMetricsHubWorker::handleMessage(
    const std::shared_ptr<QVReportingSessionMessage>& message) {
    if (!message) {
        return;
    }
    // A session that is gone has no service name; the name is formed with an empty part anyway.
    std::string_view serviceName;
    const auto owner = session();
    if (owner) {
        serviceName = QVReportingUtilityGenerateServiceNameFromServiceType(owner->serviceType());
    }
    if (names_.first.empty() || names_.category != message->category() ||
        names_.type != message->type() || names_.serviceName != serviceName) {
        names_ = {message->category(), message->type(), std::string(serviceName),
                  qvsoundEventName(*message), serviceEventName(serviceName, *message)};
    }
    sendIfUsed(names_.first, message);
    sendIfUsed(names_.second, message);
}

void QVReportingSessionMetricsHubWorker::sendIfUsed(
    const std::string& eventName, const std::shared_ptr<QVReportingSessionMessage>& message) {
    if (!analytics_.isEventUsed(eventName)) {
        return;
    }
    // The producer keeps the message alive and copies its top level when it runs, which may be
    // after this call: each call gives a fresh copy of the payload as it is then.
    analytics_.sendEventLazy(eventName, [message]() -> Dictionary { return message->message(); });
}

}  // namespace qv
