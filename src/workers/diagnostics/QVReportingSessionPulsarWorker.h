// Reacts to audio I/O overloads (type "Error", category "IO") by asking the diagnostic-request
// service for a system-wide stack sample (a spinlog), so that the cause can be examined later,
// and posts "com.korvane.qvsound.dropped-spinlog" after each request. Internal builds only, and
// only while "enable_spinlog" is set in the suite "com.korvane.qvsound.qvreporting".
//
// An overload qualifies when its "smallest_buffer_frame_size" is at least the "io_buffer_size"
// setting (512 when absent or 0) and its "io_cycle" at least the "io_cycle" setting (0); a
// session asks at most once per ten seconds. Before each request the worker pauses for
// "wait_time" microseconds, at most kMaximumWaitMicroseconds.
//
// The three settings are process-wide: every worker that is created reads them again, and every
// worker uses the values read last.
//
// Thread safety: called on the session's queue, like every worker; the pause blocks that queue.
// The settings may be read from any thread.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <string_view>

#include "session/QVReportingSessionWorker.h"

namespace qv {

class Clock;
class DiagnosticRequestService;
class NotificationCenter;
class PreferenceStore;

class QVReportingSessionPulsarWorker final : public QVReportingSessionWorkerConsumerProtocol {
  public:
    static constexpr std::string_view kClassName = "QVReportingSessionPulsarWorker";
    static constexpr std::string_view kDefaultsSuite = "com.korvane.qvsound.qvreporting";
    static constexpr std::string_view kEnableKey = "enable_spinlog";
    static constexpr std::string_view kIOBufferSizeKey = "io_buffer_size";
    static constexpr std::string_view kIOCycleKey = "io_cycle";
    static constexpr std::string_view kWaitTimeKey = "wait_time";
    static constexpr std::string_view kDroppedSpinlogNotification =
        "com.korvane.qvsound.dropped-spinlog";
    // "io_buffer_size" when the setting is absent or 0.
    static constexpr std::int32_t kDefaultIOBufferSize = 512;
    // A session asks for a spinlog at most once in this many seconds.
    static constexpr double kMinimumRequestSpacingSeconds = 10.0;
    // Guardrail: the pause blocks the reporting server queue, which every client shares, so a
    // "wait_time" beyond a quarter of a second (a typo, or a value meant in milliseconds) is cut
    // to it. Longer pauses would stall every session's messages, not just this one's.
    static constexpr std::uint64_t kMaximumWaitMicroseconds = 250000;

    // The process-wide settings, as the last worker created read them.
    struct Settings {
        std::int32_t ioBufferSize = kDefaultIOBufferSize;
        std::int32_t ioCycle = 0;
        // "wait_time" as set, and the pause actually taken (capped, 0 for a negative or NaN).
        double waitTime = 0.0;
        std::uint64_t waitMicroseconds = 0;
    };
    using Pause = std::function<void(std::chrono::microseconds)>;

    // Null unless "enable_spinlog" is set and the build is internal; otherwise reads the settings.
    static std::shared_ptr<QVReportingSessionPulsarWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    QVReportingSessionPulsarWorker(const Clock& clock, DiagnosticRequestService& diagnostics,
                                   NotificationCenter& notifications)
        : clock_(clock), diagnostics_(diagnostics), notifications_(notifications) {}

    bool start() override { return true; }
    void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& message) override;

    // True for an I/O overload (type "Error", category "IO").
    bool interestedInMessage(const QVReportingSessionMessage& message) const;

    // The suite's values: absent keys read as false / 0 / 0.0 silently, present ones are logged.
    static bool getEnableFlag(const PreferenceStore& defaults, std::string_view key);
    static std::int32_t getRunTimeDefaults(const PreferenceStore& defaults, std::string_view key);
    static double getDoubleRunTimeDefaults(const PreferenceStore& defaults, std::string_view key);

    static Settings settings();
    double lastMessageTime() const { return lastMessageTime_; }

    // For tests only: replaces the pause (empty restores the real sleep), and restores the
    // settings' defaults.
    static void TEST_setPause(Pause pause);
    static void TEST_resetSettings();

  private:
    static void readSettings(const PreferenceStore& defaults);

    // The session's platform services, taken at creation: the platform outlives every session.
    const Clock& clock_;
    DiagnosticRequestService& diagnostics_;
    NotificationCenter& notifications_;
    // Time of this session's last request, seconds since 1970; 0.0 for none.
    double lastMessageTime_ = 0.0;
};

}  // namespace qv
