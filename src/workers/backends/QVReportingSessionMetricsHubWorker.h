// Forwards every message of its session, unchanged, to the analytics event service (MetricsHub)
// under two names: "com.korvane.qvsound.<category>.<type>" and
// "com.korvane.<service>.<category>.<type>", in that order. Each name is asked about first and
// sent only when some consumer uses it; the payload is copied only then, by a producer that holds
// the message, so an unused event costs two names and two queries. Keeps no state between
// messages and derives none.
//
// Thread safety: called on the session's queue, like every worker.
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "session/QVReportingSessionWorker.h"

namespace qv {

class AnalyticsService;

class QVReportingSessionMetricsHubWorker final : public QVReportingSessionWorkerConsumerProtocol {
  public:
    static constexpr std::string_view kClassName = "QVReportingSessionMetricsHubWorker";
    static bool handleSingleMessageSession() { return true; }
    static bool startOnInit() { return true; }

    static std::shared_ptr<QVReportingSessionMetricsHubWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& message) override;

    explicit QVReportingSessionMetricsHubWorker(AnalyticsService& analytics)
        : analytics_(analytics) {}

  private:
    void sendIfUsed(const std::string& eventName,
                    const std::shared_ptr<QVReportingSessionMessage>& message);

    // The session's platform service, taken at creation: the platform outlives every session,
    // so a message still reaches the service should the session be gone.
    AnalyticsService& analytics_;
};

}  // namespace qv
