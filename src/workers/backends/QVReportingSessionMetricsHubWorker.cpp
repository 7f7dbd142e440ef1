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
    const std::string first = qvsoundEventName(*message);
    // A session that is gone has no service name; the name is formed with an empty part anyway.
    std::string_view serviceName;
    const auto owner = session();
    if (owner) {
        serviceName = QVReportingUtilityGenerateServiceNameFromServiceType(owner->serviceType());
    }
    const std::string second = serviceEventName(serviceName, *message);
    sendIfUsed(first, message);
    sendIfUsed(second, message);
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
