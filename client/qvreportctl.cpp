// qvreportctl: the audio reporting daemon's command-line client. Every bus operation, session
// scripts, the defaults store, named notifications, the guardrail counters and the sink files;
// the command groups live in QVReportingCtl*.cpp (see QVReportingCtl.h for the exit statuses).
#include <exception>
#include <functional>
#include <iostream>
#include <map>
#include <string>
#include <string_view>
#include <vector>

#include <CLI/CLI.hpp>

#include "QVReportingCtl.h"
#include "QVReportingCtlCompletion.h"
#include "QVReportingCtlSupport.h"

namespace {

using namespace qv::ctl;

int run(int argc, char** argv) {
    Options options;
    CLI::App app{
        "qvreportctl: client of the audio reporting daemon (qvreportd).\n"
        "Sessions belong to the connection that made them, and every qvreportctl run is a "
        "connection of its own: a session created by `create` ends when that run exits. Use "
        "`replay` to drive whole sessions, `start --create` to hold one open, and `send` with "
        "reporter IDs to reach sessions of other connections."};
    app.fallthrough();
    app.require_subcommand(1);
    app.add_option("--bus", options.bus, "Bus: system, session, or a bus address (unix:path=...)")
        ->capture_default_str();
    const std::map<std::string, qv::client::QVReportingTransport> transports{
        {"auto", qv::client::QVReportingTransport::Auto},
        {"bus", qv::client::QVReportingTransport::Bus},
        {"direct", qv::client::QVReportingTransport::Direct}};
    app.add_option("--transport", options.transport,
                   "How to reach the daemon: auto (its direct socket when there, else the bus), "
                   "bus, or direct")
        ->transform(CLI::CheckedTransformer(transports, CLI::ignore_case));
    app.add_option("--direct-socket", options.directSocket,
                   "The daemon's direct socket; default: /run/qvreportd/direct with the system "
                   "bus, none with another");
    app.add_option("--state-dir", options.stateDir,
                   "The daemon's state directory (defaults/, sinks/); default: "
                   "$STATE_DIRECTORY, /var/lib/qvreportd for root, else "
                   "$XDG_STATE_HOME/qvreportd or ~/.local/state/qvreportd");
    app.add_flag("--json", options.json, "Print results as JSON, one document per line");

    BusCommands bus(options);
    std::function<int()> action;

    std::string id, type, text, category, suite, key, name, sink, config;
    std::vector<std::string> ids;
    bool follow = false, create = false;

    auto* c = app.add_subcommand("create", "Create a session (CreateReportingSession)");
    c->add_option("ID", id, "Reporter ID")->required();
    c->callback([&] { action = [&] { return bus.create(id); }; });

    c = app.add_subcommand("set-type", "Set a session's service type (SetServiceType)");
    c->add_option("ID", id, "Reporter ID")->required();
    c->add_option("TYPE", type, "Service type: number or name (longformaudio, telephony, ...)")
        ->required();
    c->callback([&] { action = [&] { return bus.setType(id, type); }; });

    c = app.add_subcommand("get-type",
                           "Show a session's service type (GetServiceNameForReporterID)");
    c->add_option("ID", id, "Reporter ID")->required();
    c->callback([&] { action = [&] { return bus.getType(id); }; });

    c = app.add_subcommand("configure", "Merge a configuration into a session (SetConfiguration)");
    c->add_option("ID", id, "Reporter ID")->required();
    c->add_option("CONFIG", text, "JSON object, e.g. '{\"KXHostApplicationDisplayID\":\"x\"}'")
        ->required();
    c->callback([&] { action = [&] { return bus.configure(id, text); }; });

    c = app.add_subcommand("start",
                           "Start a session (StartReportingSession); waits until it stops");
    c->add_option("ID", id, "Reporter ID")->required();
    c->add_flag("--create", create,
                "Create the session on this connection first and hold it until Ctrl-C");
    c->add_option("--type", type, "Service type to set first (implies --create)");
    c->add_option("--config", config, "Configuration to set first, JSON (implies --create)");
    c->callback([&] { action = [&] { return bus.start(id, create, type, config); }; });

    c = app.add_subcommand("send", "Send a message (SendMessage)");
    c->add_option("CATEGORY", category, "Category: number or name (Playback, DSP_Setup, ...)")
        ->required();
    c->add_option("TYPE", type, "Event type: number or name (Start, Stop, ...)")->required();
    c->add_option("PAYLOAD", text,
                  "JSON object; {\"$now\": OFFSET} stands for the current time plus OFFSET s")
        ->required();
    c->add_option("IDS", ids,
                  "Reporter IDs (any connection's); none: every started session, or the "
                  "single-message session")
        ->delimiter(',');
    c->callback([&] { action = [&] { return bus.send(category, type, text, ids); }; });

    c = app.add_subcommand("stop", "Stop a session (StopReportingSession)");
    c->add_option("ID", id, "Reporter ID")->required();
    c->callback([&] { action = [&] { return bus.stop(id); }; });

    c = app.add_subcommand("destroy", "Destroy a session (DestroyReportingSession)");
    c->add_option("ID", id, "Reporter ID")->required();
    c->callback([&] { action = [&] { return bus.destroy(id); }; });

    c = app.add_subcommand("valid", "Look a reporter ID up across all clients (ReporterIDValid)");
    c->add_option("ID", id, "Reporter ID")->required();
    c->callback([&] { action = [&] { return bus.valid(id); }; });

    c = app.add_subcommand("list", "List every client's reporter IDs (GetAllReporters)");
    c->callback([&] { action = [&] { return bus.list(); }; });

    c = app.add_subcommand("kill", "End the daemon (KillService; root only on the system bus)");
    c->callback([&] { action = [&] { return bus.kill(); }; });

    c = app.add_subcommand("replay", "Run a session script (JSON lines; - for standard input)");
    c->add_option("FILE", text, "Script, e.g. examples/playback.jsonl")->required();
    c->callback([&] { action = [&] { return bus.replay(text); }; });

    auto* defaults = app.add_subcommand("defaults", "Read and edit the defaults store");
    defaults->require_subcommand(1);
    c = defaults->add_subcommand("read", "Print a suite, or one key of it, as JSON");
    c->add_option("SUITE", suite, "Suite, e.g. com.korvane.qvsound")->required();
    c->add_option("KEY", key, "Key");
    c->callback([&] { action = [&] { return DefaultsCommands(options, bus).read(suite, key); }; });
    c = defaults->add_subcommand("write", "Set a key to a JSON value");
    c->add_option("SUITE", suite, "Suite")->required();
    c->add_option("KEY", key, "Key")->required();
    c->add_option("VALUE", text, "JSON value, e.g. true, 3, '\"text\"'")->required();
    c->callback(
        [&] { action = [&] { return DefaultsCommands(options, bus).write(suite, key, text); }; });
    c = defaults->add_subcommand("delete", "Remove a key, or every key of a suite");
    c->add_option("SUITE", suite, "Suite")->required();
    c->add_option("KEY", key, "Key");
    c->callback(
        [&] { action = [&] { return DefaultsCommands(options, bus).remove(suite, key); }; });

    auto* notify = app.add_subcommand("notify", "Post and read named notifications");
    notify->require_subcommand(1);
    c = notify->add_subcommand("post", "Post a notification with a 64-bit state");
    c->add_option("NAME", name, "Notification name")->required();
    c->add_option("STATE", text, "State, 0 to 18446744073709551615")->required();
    c->callback([&] { action = [&] { return bus.notifyPost(name, text); }; });
    c = notify->add_subcommand("get", "Print a notification's state");
    c->add_option("NAME", name, "Notification name")->required();
    c->callback([&] { action = [&] { return bus.notifyGet(name); }; });

    c = app.add_subcommand("stats", "Print the daemon's guardrail counters (GetStats)");
    c->callback([&] { action = [&] { return bus.stats(); }; });

    c = app.add_subcommand("sinks", "Print the sink files (MTX records decoded)");
    c->add_option("NAME", sink, "One sink (analytics, mtx, ...); default: all, merged by time");
    c->add_flag("-f,--follow", follow, "Keep printing lines as they are appended");
    c->callback([&] { action = [&] { return printSinks(options, sink, follow); }; });

#ifdef QV_WITH_FLEET
    FleetOptions fleet;
    auto* fleetGroup =
        app.add_subcommand("fleet", "The exporter's counters, and the NATS stream it fills");
    fleetGroup->require_subcommand(1);
    const auto addServerOptions = [&](CLI::App* command) {
        command->add_option("--nats-url", fleet.urls, "Servers, comma-separated (tls:// for TLS)")
            ->capture_default_str();
        command->add_option("--creds", fleet.creds, "Credentials file");
        command->add_option("--nkey", fleet.nkey, "NKey file (public key and seed)");
        command->add_option("--tls-ca", fleet.tlsCA, "CA of the servers' certificates");
        command->add_option("--stream", fleet.stream, "Stream")->capture_default_str();
    };
    c = fleetGroup->add_subcommand("status",
                                   "Print qvreport-export's counters (lines sent, "
                                   "acknowledged, retried, expired, lag per sink)");
    c->callback([&] { action = [&] { return fleetStatus(options); }; });
    c = fleetGroup->add_subcommand("tail", "Print the stream's lines as `sinks` does");
    addServerOptions(c);
    c->add_option("--device", fleet.device, "One device (32 hex digits); default: all");
    c->add_option("--sink", fleet.sink, "One sink; default: all");
    c->add_flag("-f,--follow", fleet.follow, "Keep printing lines as they arrive");
    c->callback([&] { action = [&] { return fleetTail(options, fleet); }; });
    c = fleetGroup->add_subcommand("devices", "List the devices seen with their last report");
    addServerOptions(c);
    c->callback([&] { action = [&] { return fleetDevices(options, fleet); }; });
#endif

    ReportOptions reportOptions;
    c = app.add_subcommand("report",
                           "Write an HTML page with plots of what the sinks hold (sessions, "
                           "playback, volume, issues, guardrail counters)");
    c->add_option("--since", reportOptions.since,
                  "From this time: seconds since 1970, or ISO 8601 (2026-11-26, "
                  "2026-11-26T09:30, ...Z or +01:00; local time without a zone)");
    c->add_option("--until", reportOptions.until, "Up to this time (left out), as --since");
    c->add_option("--app", reportOptions.application, "One application only");
    c->add_option("-o,--output", reportOptions.output,
                  "The page to write (default: report.html here); its path is printed");
    c->add_flag("--summary", reportOptions.summary,
                "Print one line per session instead (application, service, what was derived, "
                "issues)");
    c->callback([&] { action = [&] { return report(options, reportOptions); }; });

    c = app.add_subcommand("captures",
                           "List the issue captures (logs/Audio/Captures) with their manifests");
    c->callback([&] { action = [&] { return printCaptures(options); }; });

    // What the shell completion function asks for (QVReportingCtlCompletion.h), read before the
    // parser, which would drop the empty word under the cursor.
    if (argc > 2 && argv[1] == std::string_view("__complete") &&
        argv[2] == std::string_view("--")) {
        return QVReportingCtlComplete(app, std::vector<std::string>(argv + 3, argv + argc));
    }

    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        // Help is a "parse error" that exits 0; every real one is a usage error.
        return app.exit(e) == 0 ? 0 : kExitUsage;
    }
    if (options.stateDir.empty()) {
        options.stateDir = qv::client::QVReportingCtlDefaultStateDirectory();
    }
    try {
        return action ? action() : kExitUsage;
    } catch (const UsageError& e) {
        std::cerr << "qvreportctl: " << e.message << std::endl;
        return kExitUsage;
    } catch (const Failure& e) {
        std::cerr << "qvreportctl: " << e.message << std::endl;
        return kExitFailed;
    } catch (const QVReportingClientError& e) {
        std::cerr << "qvreportctl: " << e.message() << " [" << e.name() << "]" << std::endl;
        return e.isDaemonNotRunning() ? kExitNotRunning : kExitFailed;
    } catch (const qv::client::QVReportingJsonConversionError& e) {
        std::cerr << "qvreportctl: " << e.what() << std::endl;
        return kExitUsage;
    } catch (const std::exception& e) {
        std::cerr << "qvreportctl: " << e.what() << std::endl;
        return kExitFailed;
    }
}

}  // namespace

int main(int argc, char** argv) {
    return run(argc, argv);
}