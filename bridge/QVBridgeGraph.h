// The PipeWire side of the bridge: a client of PipeWire that watches its registry (clients,
// devices, nodes, links and the profiler where the server loads it), keeps one small record per
// object by global id, and feeds the states of audio stream nodes to the reporter, whose
// operations it pushes onto the queue. It never waits on anything but PipeWire: the queue's push
// does not block.
//
// When PipeWire goes away every session is closed (a running stream with a Stop first); the
// bridge connects again every second and reports the streams it then finds as new sessions.
//
// run() drives PipeWire's main loop on the calling thread until quit() (from any thread), SIGINT
// or SIGTERM, then closes every session.
#pragma once

#include <memory>
#include <string>

#include "QVBridgeEventQueue.h"
#include "QVBridgeReporter.h"
#include "QVBridgeStats.h"

namespace qv::bridge {

class QVBridgeGraph {
  public:
    struct Options {
        std::string remote;  // the PipeWire remote's name; empty: as the environment says
    };

    QVBridgeGraph(QVBridgeEventQueue& queue, QVBridgeStats& stats, QVBridgeReporter& reporter,
                  Options options);
    ~QVBridgeGraph();
    QVBridgeGraph(const QVBridgeGraph&) = delete;
    QVBridgeGraph& operator=(const QVBridgeGraph&) = delete;

    void run();
    void quit();

  private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace qv::bridge
