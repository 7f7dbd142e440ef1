// The performance-trace recorder (SpanTrace): records a system trace from start to stop and
// leaves it in a trace file that the trace-model reader (ThreadlineModelReader.h) reads back.
//
// A recording is made from a configuration, which comes from a numbered template (the trace
// worker asks for 2, a scheduling trace, or 3, a profile with interrupts and audio events). Its
// delegate hears, on a thread of the recorder's own and never on the caller's:
// - spanTraceDidStart once, when the recording runs or has failed to start (with an error);
// - spanTraceDidStop once after stop(), when the recording has stopped (with an error if it
//   could not be stopped cleanly);
// - spanTraceDidComplete exactly once for every recording that was started: with the trace
//   file's location when the trace was written, or with an error and no location when nothing
//   was recorded (a failed start completes at once, so a waiter never waits for a trace that
//   cannot come).
// A delegate is held weakly: one that is gone is not called. Callbacks of one recording come in
// the order start, stop, complete; no lock of the recorder's is held while they run, so a
// delegate may call back into its recording (setDelegate, isValid) from inside one.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <filesystem>
#include <memory>
#include <optional>
#include <string>

namespace qv {

// How a recording is made; obtained from a template, then adjusted by the caller.
struct SpanTraceConfiguration {
    int templateNumber = 2;
    // Whether the finished trace file is compressed; callers set false.
    bool compressWhenFinished = true;
};

class SpanTraceDelegate {
  public:
    virtual ~SpanTraceDelegate() = default;

    // error: a readable description, or nothing on success.
    virtual void spanTraceDidStart(const std::optional<std::string>& error) = 0;
    virtual void spanTraceDidStop(const std::optional<std::string>& error) = 0;
    // location: the finished trace file, nothing when there is none; token: names the recording.
    virtual void spanTraceDidComplete(const std::optional<std::filesystem::path>& location,
                                      const std::string& token,
                                      const std::optional<std::string>& error) = 0;
};

// One recording.
class SpanTraceSession {
  public:
    virtual ~SpanTraceSession() = default;

    virtual void setDelegate(std::weak_ptr<SpanTraceDelegate> delegate) = 0;
    // Begins the recording; the answer comes through spanTraceDidStart. A second call is ignored.
    virtual void start() = 0;
    // Ends the recording; answers with spanTraceDidStop, then spanTraceDidComplete. Ignored
    // before start() and after the first stop().
    virtual void stop() = 0;
    // True while the recording may still be stopped: started or starting, not failed, not yet
    // stopped.
    virtual bool isValid() const = 0;
};

class SpanTraceRecorder {
  public:
    virtual ~SpanTraceRecorder() = default;

    // The configuration of a numbered template, or null when the recorder has no such template.
    virtual std::shared_ptr<SpanTraceConfiguration> configurationFromTemplate(
        int templateNumber) = 0;
    // A new recording, not yet started. Never null.
    virtual std::shared_ptr<SpanTraceSession> createSession(
        const SpanTraceConfiguration& configuration) = 0;
};

}  // namespace qv
