// Prompts a person on an internal build to file a bug report when a Vidcall session hands the
// audio layer invalid x/y coordinates for spatial audio (a payload key that begins with
// "vcac_invalid_"). At most one draft per session, and at most one per back-off period on the
// device: the back-off ("VidcallInvalidXyBackOffSeconds" in the suite
// "com.korvane.qvsound.qvreporting") must be set for the worker to exist at all, and the time of
// the last request ("VidcallInvalidXyITFlastRun") is kept in that suite.
//
// The first message a worker sees opens a grace period of five seconds in which errors are not
// acted on: a call that begins badly is left to settle first.
//
// Thread safety: called on the session's queue, like every worker. The draft's completion runs on
// the IssueFiler service's thread and only logs.
#pragma once

#include <memory>
#include <string_view>

#include "platform/IssueFilerService.h"
#include "session/QVReportingSessionWorker.h"

namespace qv {

class Clock;
class PreferenceStore;

class QVReportingSessionIssueFilerWorker final : public QVReportingSessionWorkerConsumerProtocol {
  public:
    static constexpr std::string_view kClassName = "QVReportingSessionIssueFilerWorker";
    static constexpr std::string_view kDefaultsSuite = "com.korvane.qvsound.qvreporting";
    static constexpr std::string_view kBackOffSecondsKey = "VidcallInvalidXyBackOffSeconds";
    static constexpr std::string_view kLastRunKey = "VidcallInvalidXyITFlastRun";
    // Messages up to this long after the first one the worker sees are not acted on.
    static constexpr double kGracePeriodSeconds = 5.0;
    static constexpr std::string_view kDisplayReason =
        "a Vidcall spatial positioning error occurred";

    static bool handleSingleMessageSession() { return true; }

    // Null on a customer build, or when the back-off setting is absent.
    static std::shared_ptr<QVReportingSessionIssueFilerWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    QVReportingSessionIssueFilerWorker(const Clock& clock, PreferenceStore& defaults,
                                       IssueFilerService& issueFiler, double backOffTime)
        : clock_(clock), defaults_(defaults), issueFiler_(issueFiler), backOffTime_(backOffTime) {}

    void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& message) override;
    void stop() override;

    // Whether the message is a Vidcall x/y error after the grace period, with no draft requested
    // on the device within the back-off. Opens the grace period on the first call; asking may
    // record a run (see hasRunInTimeframe).
    bool interestedInMessage(const QVReportingSessionMessage& message);
    // Whether a draft was requested within the last backOffSeconds, by the time stored under key.
    // When not, now is stored under key before the answer is given: asking counts as running, so
    // that two sessions cannot both prompt within one back-off.
    bool hasRunInTimeframe(double backOffSeconds, std::string_view key);

    static IssueDraft issueDraftForVidcallXYerror();

    bool hasRun() const { return hasRun_; }
    double backOffTime() const { return backOffTime_; }
    double minimumMessageTime() const { return minimumMessageTime_; }

  private:
    // The session's platform services, taken at creation: the platform outlives every session.
    const Clock& clock_;
    PreferenceStore& defaults_;
    IssueFilerService& issueFiler_;
    const double backOffTime_;
    bool hasRun_ = false;
    // Messages at or before this time (seconds since 1970) are ignored; not above 0 until the
    // first message.
    double minimumMessageTime_ = -1.0;
};

}  // namespace qv
