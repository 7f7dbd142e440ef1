// qvreport-export: ships every line of the daemon's sinks to a NATS JetStream stream, each
// exactly once, from a cursor kept in the state directory. See QVReportingExportShipper.h.
#include <csignal>
#include <iostream>
#include <thread>

#include <pthread.h>
#include <CLI/CLI.hpp>

#include "QVReportingExportDevice.h"
#include "QVReportingExportFiles.h"
#include "QVReportingExportShipper.h"

namespace {

using namespace qv::exporter;

int run(int argc, char** argv) {
    QVReportingExportSettings settings;
    auto& server = settings.server;
    std::string stateDir;
    server.urls = "nats://127.0.0.1:4222";
    int ackWaitMs = static_cast<int>(settings.ackWait.count());
    int duplicateWindowS = static_cast<int>(server.duplicateWindow.count());

    CLI::App app{
        "qvreport-export: ships every sink line of the audio reporting daemon to a NATS "
        "JetStream stream, exactly once (subject qvreporting.DEVICE.SINK, message ID "
        "DEVICE.SINK.SEQ). The cursor is kept in STATE_DIR/export/cursor.json, the counters in "
        "STATE_DIR/export/status.json (qvreportctl fleet status)."};
    app.add_option("--state-dir", stateDir,
                   "The daemon's state directory (sinks/ is read, export/ written); default: "
                   "$STATE_DIRECTORY, /var/lib/qvreportd for root, else "
                   "$XDG_STATE_HOME/qvreportd or ~/.local/state/qvreportd");
    app.add_option("--nats-url", server.urls,
                   "Servers, comma-separated (nats://HOST:PORT, tls://HOST:PORT for TLS)")
        ->capture_default_str();
    auto* creds =
        app.add_option("--creds", server.credsFile, "Credentials file (user JWT and seed)")
            ->check(CLI::ExistingFile);
    app.add_option("--nkey", server.nkeyFile,
                   "NKey file: the user's public key (U...) and seed (SU...), a line each")
        ->check(CLI::ExistingFile)
        ->excludes(creds);
    app.add_option("--tls-ca", server.tlsCAFile,
                   "CA certificates the servers' TLS certificates are checked against")
        ->check(CLI::ExistingFile);
    app.add_option("--stream", server.stream, "Stream, made when missing")->capture_default_str();
    app.add_option("--replicas", server.replicas, "Replicas of a stream this makes")
        ->check(CLI::IsMember({1, 3}))
        ->capture_default_str();
    app.add_option("--max-pending", settings.maxPending, "Acknowledgements in flight at most")
        ->check(CLI::Range(1, 1 << 20))
        ->capture_default_str();
    app.add_option("--ack-wait-ms", ackWaitMs,
                   "A publish not acknowledged within this is sent again")
        ->check(CLI::Range(100, 600000))
        ->capture_default_str();
    app.add_option("--duplicate-window-s", duplicateWindowS,
                   "Duplicate window of a stream this makes (longer than any resend)")
        ->check(CLI::Range(10, 7 * 24 * 3600))
        ->capture_default_str();
    app.add_flag("--log-answers", settings.logAnswers,
                 "Logs the stream's answer to every line: where it stored it, or why not");
    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        return app.exit(e) == 0 ? 0 : 2;
    }
    settings.ackWait = std::chrono::milliseconds(ackWaitMs);
    server.duplicateWindow = std::chrono::seconds(duplicateWindowS);
    settings.stateDir = stateDir.empty() ? QVReportingExportDefaultStateDirectory() : stateDir;

    std::string error;
    settings.device = QVReportingExportDeviceID(error);
    if (settings.device.empty()) {
        std::cerr << "qvreport-export: " << error << std::endl;
        return 1;
    }

    // Signals are taken by one thread (before the library starts its own, which inherit the
    // mask); the handler's only work is to ask the shipper to stop.
    sigset_t stopSignals;
    sigemptyset(&stopSignals);
    sigaddset(&stopSignals, SIGTERM);
    sigaddset(&stopSignals, SIGINT);
    pthread_sigmask(SIG_BLOCK, &stopSignals, nullptr);
    std::signal(SIGPIPE, SIG_IGN);

    QVReportingExportShipper shipper(std::move(settings));
    std::thread signals([&] {
        int signal = 0;
        sigwait(&stopSignals, &signal);
        shipper.stop();
    });
    const int status = shipper.run();
    if (status != 0) {
        shipper.stop();
        pthread_kill(signals.native_handle(), SIGTERM);
    }
    signals.join();
    return status;
}

}  // namespace

int main(int argc, char** argv) {
    return run(argc, argv);
}
