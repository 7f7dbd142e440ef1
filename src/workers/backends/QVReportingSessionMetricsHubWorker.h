// Forwards every message of its session, unchanged, to the analytics event service (MetricsHub)
// under two names: "com.korvane.qvsound.<category>.<type>" and
// "com.korvane.<service>.<category>.<type>", in that order. Each name is asked about first and
// sent only when some consumer uses it; the payload is copied only then, by a producer that holds
// the message, so an unused event costs two names and two queries. Derives nothing from the
// messages; it keeps only the two names of the last message's kind, as a stream of messages
// mostly repeats one category and type.
//
// Thread safety: called on the session's queue, like every worker.
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "session/QVReportingSessionWorker.h"
#include "session/QVReportingVocabulary.h"

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

    // The event names of the last message, and the kind of message they were made for.
    struct Names {
        AudioEventCategory category = 0;
        AudioEventType type = 0;
        std::string serviceName;
        std::string first;  // empty until a message came
        std::string second;
    };
    Names names_;
};

}  // namespace qv
