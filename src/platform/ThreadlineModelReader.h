// The trace-model reader (Threadline): builds a model of a trace file that the recorder
// (SpanTraceRecorder.h) left, and evaluates probes against it. A probe is a named interval of
// interest; its events are the intervals the trace holds, each with a duration in the model's
// time base, which the model converts to seconds.
//
// Probes are described by dictionaries, as a client's probe list (an XML property list) holds
// them:
//   "Name"         string, required: the probe's name, which its events carry;
//   "BeginMarker"  string: the marker text that opens an interval;
//   "EndMarker"    string: the marker text that closes it;
//   "Children"     array of probe dictionaries, optional.
// A probe with children is a group: its children are evaluated, not the group itself. A probe
// without children needs both markers, and they must differ. Markers are texts that the traced
// programs write into the trace (on Linux, to tracefs's trace_marker); the implementation says
// how begins and ends are paired.
//
// Thread safety: a reader may be used from any thread; a model is immutable once built, so
// several threads may evaluate probes against it at once.
#pragma once

#include <cstdint>
#include <filesystem>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "values/Value.h"

namespace qv {

namespace threadline {
inline constexpr std::string_view kProbeName = "Name";
inline constexpr std::string_view kProbeBeginMarker = "BeginMarker";
inline constexpr std::string_view kProbeEndMarker = "EndMarker";
inline constexpr std::string_view kProbeChildren = "Children";
}  // namespace threadline

struct ThreadlineEvent {
    std::string name;
    // In the model's time base; see ThreadlineModel::secondsFromTimebase.
    std::uint64_t duration = 0;
};

struct ThreadlineProbe {
    std::string name;
    std::vector<ThreadlineProbe> children;
    std::vector<ThreadlineEvent> events;  // in the order the intervals began
    // The probe as log lines print it (markers, counts of events and of markers left unpaired).
    std::string description;
};

class ThreadlineModel {
  public:
    virtual ~ThreadlineModel() = default;

    // Probes made from the dictionaries, in their order, with their events in this trace. A
    // dictionary that describes no valid probe is left out, and why is appended to problems
    // (when given).
    virtual std::vector<ThreadlineProbe> probesFromDictionaries(
        const std::vector<Dictionary>& dictionaries,
        std::vector<std::string>* problems = nullptr) const = 0;
    // A duration of the model's time base in seconds.
    virtual double secondsFromTimebase(std::uint64_t duration) const = 0;
    // What the trace held, for the log (markers read, events lost by the kernel, ...).
    virtual std::string summary() const = 0;
};

class ThreadlineModelReader {
  public:
    struct Built {
        std::shared_ptr<const ThreadlineModel> model;  // null on failure
        std::string error;                             // why, when model is null
    };

    virtual ~ThreadlineModelReader() = default;

    // Reads the trace file at location.
    virtual Built modelFromTraceFile(const std::filesystem::path& location) = 0;
};

}  // namespace qv
