// Turns the changing states of stream nodes into reporting-session operations: one session per
// stream, opened when the node appears, started on its first run, closed when it goes.
//
//   running false -> true   Playback Start (4,1) / Record Start (2,1), "session_output_running"
//                           or "session_input_running" true
//   running true -> false   Playback Stop (4,2) / Record Stop (2,2), the same key false
//   volume or mute          Volume State (14,18)
//   linked elsewhere        RouteChange State (10,18)
//   format                  Output State (5,18) / Input State (3,18)
//   xruns                   IO Error (7,6): "issue_type" "overload", the quantum in frames as
//                           "smallest_buffer_frame_size", the stream's xruns so far as "io_cycle"
//   node gone               Stop first when it was running, then the session is closed
//
// Every message carries the stream's whole state ("KXSessionVolume", "active_devices",
// "session_selected_format", "mFormatID", "mChannelsPerFrame"), so the daemon's derived messages
// read each stretch from any of them. Nothing is sent before the first run: the Start carries
// what changed until then. A change that comes with a start or stop rides on that message.
//
// Not thread-safe: one owner (the PipeWire loop) calls it.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "QVBridgeEvent.h"
#include "QVBridgeStreamState.h"

namespace qv::bridge {

class QVBridgeReporter {
  public:
    // Reporter IDs are firstReporterID, firstReporterID + 1, ... in the order streams appear.
    explicit QVBridgeReporter(std::int64_t firstReporterID);

    // The node's state now; the operations that bring its session up to date.
    std::vector<QVBridgeEvent> update(const QVBridgeStreamState& now);
    // xruns more cycles of the node went wrong; quantum is its driver's cycle in frames.
    std::vector<QVBridgeEvent> xruns(std::uint32_t nodeID, std::uint64_t count,
                                     std::uint32_t quantum, const std::string& driver);
    // The node went away.
    std::vector<QVBridgeEvent> remove(std::uint32_t nodeID);
    // Every node went away (PipeWire stopped, or the bridge does).
    std::vector<QVBridgeEvent> removeAll();

    bool tracks(std::uint32_t nodeID) const { return streams_.count(nodeID) != 0; }
    std::size_t size() const { return streams_.size(); }

  private:
    struct Reported {
        std::int64_t reporterID = 0;
        QVBridgeStreamState last;
        bool started = false;
        std::uint64_t xruns = 0;
    };

    static QVBridgePayload statePayload(const QVBridgeStreamState& state);
    static QVBridgeEvent message(const Reported& r, std::uint32_t category, std::uint16_t type,
                                 QVBridgePayload payload);
    static QVBridgeEvent runningMessage(const Reported& r, const QVBridgeStreamState& state,
                                        bool running);

    std::int64_t nextReporterID_;
    std::map<std::uint32_t, Reported> streams_;
};

}  // namespace qv::bridge
