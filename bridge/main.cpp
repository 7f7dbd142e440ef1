// qvreport-pipewire: every audio stream that plays or records through PipeWire becomes a reporting
// session of the daemon. PipeWire's loop runs on the main thread; the daemon is called from a
// thread of the bridge's own, fed through a bounded queue.
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <string>

#include <pipewire/pipewire.h>
#include <CLI/CLI.hpp>

#include "QVBridgeEventQueue.h"
#include "QVBridgeGraph.h"
#include "QVBridgeLog.h"
#include "QVBridgeReporter.h"
#include "QVBridgeSender.h"
#include "QVBridgeStats.h"

using namespace qv::bridge;

int main(int argc, char** argv) {
    CLI::App app{
        "Reports the audio streams that play and record through PipeWire to the audio reporting "
        "daemon, one reporting session per stream.\n\nThe daemon is called from a thread of the "
        "bridge's own, never from PipeWire's loop. Events wait for it in a queue of at most "
        "--queue-size messages (" +
            std::to_string(QVBridgeEventQueue::kDefaultCapacity) +
            " by default, a few hundred bytes each); a message that finds the queue full is "
            "dropped and counted (events_dropped in the exit line). Sessions are made again when "
            "the daemon or PipeWire restarts.",
        "qvreport-pipewire"};
    std::string bus = "session";
    std::string remote;
    bool dryRun = false;
    std::size_t queueSize = QVBridgeEventQueue::kDefaultCapacity;
    std::string logLevel = "info";
    app.add_option("--bus", bus,
                   "the daemon's bus: system, session or a bus address (unix:path=...)")
        ->capture_default_str();
    app.add_option("--remote", remote,
                   "the PipeWire remote to connect to (default: $PIPEWIRE_REMOTE, else "
                   "pipewire-0 in $PIPEWIRE_RUNTIME_DIR or $XDG_RUNTIME_DIR)");
    app.add_flag("--dry-run", dryRun,
                 "call nothing: print each operation the daemon would get as a line of JSON");
    app.add_option("--queue-size", queueSize,
                   "messages that may wait for the daemon; more are dropped and counted")
        ->capture_default_str()
        ->check(CLI::Range(std::size_t{1}, std::size_t{1} << 20));
    app.add_option("--log-level", logLevel, "debug, info or error")
        ->capture_default_str()
        ->check(CLI::IsMember({"debug", "info", "error"}));
    CLI11_PARSE(app, argc, argv);

    QVBridgeSetLogLevel(logLevel == "debug"  ? QVBridgeLogLevel::kDebug
                        : logLevel == "info" ? QVBridgeLogLevel::kInfo
                                             : QVBridgeLogLevel::kError);

    // Blocked before any thread starts (PipeWire's own included), so that SIGINT and SIGTERM
    // reach only the main loop's signal handler, which stops every session first.
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGINT);
    sigaddset(&signals, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);

    pw_init(&argc, &argv);
    int status = 0;
    {
        QVBridgeStats stats;
        QVBridgeEventQueue queue(queueSize, stats);
        // IDs of this process's own range: another bridge on the same daemon picks others.
        QVBridgeReporter reporter((static_cast<std::int64_t>(getpid()) << 24) + 1);
        QVBridgeSender::Options senderOptions;
        senderOptions.bus = bus;
        senderOptions.dryRun = dryRun;
        QVBridgeSender sender(queue, stats, senderOptions);
        QVBridgeGraph::Options graphOptions;
        graphOptions.remote = remote;
        {
            QVBridgeGraph graph(queue, stats, reporter, graphOptions);
            sender.start();
            graph.run();
        }
        queue.close();
        sender.join();
        QVBridgeLog(QVBridgeLogLevel::kInfo, "stopped: {}", stats.summary());
    }
    pw_deinit();
    return status;
}
