// An ICX detector: recognises one kind of audio issue among a session's messages. The ICX worker
// counts the messages a detector is interested in and, when the detector's counting rule is met,
// has it fire: ask the issue-capture service for diagnostics.
//
// A detector class T provides `static constexpr std::string_view kClassName`, `static
// std::shared_ptr<T> initWithSession(const std::shared_ptr<QVReportingSession>&)` (null: not
// registered), and may declare `static bool handleSingleMessageSession()`; a class without it
// never joins a single-message session.
//
// Thread safety: called on the reporting server queue, like the worker.
#pragma once

#include <cstdint>
#include <memory>
#include <string_view>
#include <vector>

#include "session/QVReportingSessionMessage.h"
#include "workers/diagnostics/WorkerInstanceState.h"

namespace qv {

class QVReportingSession;

class QVReportingICXWorkerInstance {
  public:
    explicit QVReportingICXWorkerInstance(const std::shared_ptr<QVReportingSession>& session)
        : session_(session) {}
    QVReportingICXWorkerInstance(const QVReportingICXWorkerInstance&) = delete;
    QVReportingICXWorkerInstance& operator=(const QVReportingICXWorkerInstance&) = delete;
    virtual ~QVReportingICXWorkerInstance() = default;

    virtual std::string_view className() const = 0;
    virtual bool interestedInMessage(const QVReportingSessionMessage& message) = 0;
    virtual WorkerInstanceState& workerState() = 0;

    // Called for every interesting message, before it is remembered as the last one.
    virtual void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& /*message*/) {}
    // Whether the detector fires at all; one that does not only counts.
    virtual bool implementsFire() const { return false; }
    // The request for diagnostics; message completed the counting rule.
    virtual void fire(const std::shared_ptr<QVReportingSessionMessage>& /*message*/) {}
    virtual void start() {}
    virtual void stop() {}

    std::shared_ptr<QVReportingSession> session() const { return session_.lock(); }

  private:
    std::weak_ptr<QVReportingSession> session_;
};

}  // namespace qv

namespace qv {

// The snapshot payload of the leak detectors: kIssueCaptureKeyPayloadDEParameters ->
// "com.korvane.EnergylogCore.DESysLogFilterProcess" -> "processIDs" -> the session's client
// process identifiers.
Dictionary QVReportingICXSnapshotPayload(const std::vector<std::int64_t>& processIdentifiers);

}  // namespace qv
