// The weekly, privacy-reduced registration report of the user's wireless earbuds.
//
// Messages whose "active_devices" text says an earbud is among the active audio devices trigger,
// at most once a minute, a gathering of the accessory information (BTAccess), whose result is
// kept in the user-defaults suite "com.korvane.qvsound.qvreporting.audioreg". When a session
// stops and the publication time has come, the devices seen connected in the last 8 days are
// published to the Convo service, one message each (category 17 "Earlink", type 11 "Summary"),
// with the connection time reduced to a week-of-year number. The first publication of an
// installation waits for a random moment of its first week; a publication that is due moves the
// next one a day on (a retry should it fail), a successful send a week on from the send.
//
// The registration information, the two schedule times and the BTAccess are shared by every
// session of the process; the gathering runs under one process-wide lock.
//
// Thread safety: the worker runs on the session's queue, except the Convo configuration
// callback, which runs on the Convo service's thread and touches only the worker's Convo
// session (under its lock), its started flag (atomic) and the shared schedule (under its lock).
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "session/QVReportingSessionWorker.h"
#include "values/Value.h"

namespace qv {

class ConvoSession;
struct Platform;

class QVReportingSessionAudioRegistrationWorker final
    : public QVReportingSessionWorkerConsumerProtocol,
      public std::enable_shared_from_this<QVReportingSessionAudioRegistrationWorker> {
  public:
    static constexpr std::string_view kClassName = "QVReportingSessionAudioRegistrationWorker";

    static constexpr std::string_view kSuite = "com.korvane.qvsound.qvreporting.audioreg";
    static constexpr std::string_view kRegistrationInfoKey = "ELRegistrationInfo";
    static constexpr std::string_view kEnumerationCheckEpochKey =
        "AudioRegistrationELEnumerationCheckEpoch";
    static constexpr std::string_view kNextInvocationEpochKey =
        "AudioRegistrationNextInvocationEpoch";
    static constexpr std::string_view kActiveDevicesKey = "active_devices";
    static constexpr std::string_view kTrigger = "qwrT ( b71c ) ( 6402 )";
    static constexpr std::string_view kLastConnectedWW = "lastConnectedWW";

    static constexpr double kGatheringInterval = 60;
    static constexpr std::uint32_t kFirstPublicationWindow = 604800;
    static constexpr double kRetryInterval = 86400;
    static constexpr double kPublicationInterval = 604800;
    static constexpr double kActivitySpan = 691200;

    static constexpr std::string_view kConvoClientName = "Earlink_Telemetry";
    static constexpr std::string_view kConvoServiceName = "Earlink_Registration";
    static constexpr std::int64_t kConvoClientType = 19;
    static constexpr std::string_view kVersionNumber = "2.1";
    static constexpr AudioEventCategory kPublishedCategory = 17;  // Earlink
    static constexpr AudioEventType kPublishedType = 11;          // Summary

    // A whole number drawn uniformly from [0, bound).
    using RandomSource = std::function<std::uint32_t(std::uint32_t bound)>;

    static std::shared_ptr<QVReportingSessionAudioRegistrationWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    bool start() override;
    void stop() override;
    void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& message) override;

    // Opens a Convo session for the report and, once it has backends, sends one message per
    // device entry.
    void setupConvoReporterInterface(const Array& devices);
    // Sends one message on the worker's Convo session; success moves the next publication a
    // week on.
    void _sendMessage(const QVReportingSessionMessage& message);
    // The week of the year (1 to 53) of epoch in the device's current time zone: Gregorian
    // calendar, weeks begin on Sunday, week 1 is the week that holds 1 January.
    static int _convertEpochToWorkWeek(std::uint32_t epoch);
    static std::uint16_t retrieveConvoReportingCategoryFromCategory(AudioEventCategory category);

    bool convoReportingSessionStarted() const { return convoReportingSessionStarted_.load(); }

    explicit QVReportingSessionAudioRegistrationWorker(const Platform& platform)
        : platform_(platform) {}

    // For tests: forgets the process-wide state (registration information, schedule, BTAccess),
    // so the next worker loads it afresh from its platform.
    static void TEST_resetSharedState();
    // For tests: replaces the random source of the first publication time (empty: the default).
    static void TEST_setRandomSource(RandomSource source);

  private:
    // Loads the registration information once per process.
    void loadSharedState();
    // Stores the next publication time, in memory and in the suite.
    void storeNextInvocation(double epoch);

    const Platform& platform_;
    mutable std::mutex convoMutex_;
    std::shared_ptr<ConvoSession> convoReportingSession_;  // guarded by convoMutex_
    std::optional<std::string> convoReportingAgentToken_;  // guarded by convoMutex_
    std::atomic<bool> convoReportingSessionStarted_{false};
};

}  // namespace qv
