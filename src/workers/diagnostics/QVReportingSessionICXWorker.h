// Runs the ICX issue detectors over the messages of a session (internal builds only). Each
// detector says which messages interest it; the worker counts them per detector and, when a
// detector's counting rule is met, has it fire: the detector asks the issue-capture service for a
// snapshot or a timed session, identified by an issue signature.
//
// The counting rule, per detector and message: an exact repeat of the last counted payload is
// skipped; an interesting message is counted (the first one of a round notes the time); the
// detector fires once the count reaches its threshold, or, with a count threshold of 0, once
// strictly more than its duration has passed since the first counted message; a once-per-session
// detector that has fired before does not fire again. A fire makes a new issue-capture client,
// counts the fire and resets the round; in a session of the "test" service type it is consumed
// without asking the service.
//
// Thread safety: called on the reporting server queue, like every worker. The issue-capture
// service's replies arrive on other threads and only store an identifier in a detector's state.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "session/QVReportingSession.h"
#include "session/QVReportingSessionWorker.h"
#include "values/Value.h"
#include "workers/diagnostics/QVReportingICXWorkerInstance.h"

namespace qv {

class IssueCaptureReporter;

class QVReportingSessionICXWorker final : public QVReportingSessionWorkerConsumerProtocol {
  public:
    static constexpr std::string_view kClassName = "QVReportingSessionICXWorker";
    // What getSessionIdentifierFromResponse answers when the service named no session.
    static constexpr std::string_view kNoneReturned = "NONE_RETURNED";

    static bool handleSingleMessageSession() { return true; }

    // Null unless the build is internal.
    static std::shared_ptr<QVReportingSessionICXWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    bool start() override;
    void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& message) override;
    void stop() override;
    bool handleRedundantMessages() const override { return true; }

    // Registers detector class T, unless the session is a single-message session that T does not
    // serve; a detector whose initializer answers null is not registered.
    template <typename T>
    void addInstance();

    // The session identifier in a reply of the issue-capture service, or "NONE_RETURNED"; every
    // failure is logged with its reason.
    static std::string getSessionIdentifierFromResponse(const Dictionary& response);

    // The issue signature of a message: domain "AudioAnalytics", the service name of
    // serviceType, the message's category and type strings, the process name, no thresholds.
    static Dictionary signatureFromMessage(const QVReportingSessionMessage& message,
                                           AudioServiceType serviceType,
                                           IssueCaptureReporter& issueReporter,
                                           std::string_view clientProcessName);

    const std::vector<std::shared_ptr<QVReportingICXWorkerInstance>>& instances() const {
        return instances_;
    }

  private:
    std::vector<std::shared_ptr<QVReportingICXWorkerInstance>> instances_;
};

template <typename T>
void QVReportingSessionICXWorker::addInstance() {
    const auto owner = session();
    if (!owner) {
        return;
    }
    if (owner->isSingleMessageSession()) {
        if constexpr (requires { T::handleSingleMessageSession(); }) {
            if (!T::handleSingleMessageSession()) {
                return;
            }
        } else {
            return;
        }
    }
    if (auto instance = T::initWithSession(owner)) {
        instances_.push_back(std::move(instance));
    }
}

}  // namespace qv
