// qvreportctl's command groups and what they share: the options every command reads, the two
// kinds of failure and their exit statuses, JSON output, and the parsing of reporter IDs and
// JSON arguments. One file per group: bus commands, session scripts, the defaults store and the
// sink files; qvreportctl.cpp holds the command line.
//
// Exit status: 0 done; 1 a call or file operation failed; 2 bad arguments or input; 3 the daemon
// is not running on the chosen bus. Messages for people go to standard error; with --json,
// results go to standard output as one JSON document per line.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include <nlohmann/json.hpp>

#include "QVReportingClient.h"
#include "QVReportingJsonVariant.h"
#include "platform/linux/system/LinuxPreferenceStore.h"

namespace qv::ctl {

// How long a command or a script waits, after stopping a session, for its held start reply.
inline constexpr auto kStartReplyWait = std::chrono::seconds(5);

using client::QVReportingClient;
using client::QVReportingClientError;
using client::VariantMap;
using Json = nlohmann::ordered_json;

inline constexpr int kExitFailed = 1;
inline constexpr int kExitUsage = 2;
inline constexpr int kExitNotRunning = 3;

// A problem with what the user gave us (exit 2), as opposed to a failed call (exit 1).
struct UsageError {
    std::string message;
};
struct Failure {
    std::string message;
};

struct Options {
    std::string bus = "system";
    // How to reach the daemon, and its direct socket (empty: the system service's, for the
    // system bus).
    qv::client::QVReportingTransport transport = qv::client::QVReportingTransport::Auto;
    std::string directSocket;
    std::string stateDir;
    bool json = false;
};

// JSON text on one line (indent -1) or indented; bad UTF-8 is replaced, never thrown.
std::string dump(const Json& json, int indent = -1);
// One JSON document on standard output.
void emit(const Json& json);
// Seconds since 1970.
double now();
// A reporter ID argument, or a UsageError.
std::int64_t reporterID(const std::string& text);
// A JSON argument, or a UsageError naming what it was meant to be.
Json parseJson(const std::string& text, const std::string& what);
// A JSON object argument as D-Bus variants ({"$now": OFFSET} is the current time plus OFFSET).
VariantMap variantMap(const std::string& text, const std::string& what);
// "2 (telephony)"
std::string serviceTypeText(std::uint16_t serviceType);
// "[1, 2]", or "all started sessions" for none.
std::string idsText(const std::vector<std::int64_t>& ids);

// --- Bus commands (QVReportingCtlBusCommands.cpp, replay in QVReportingCtlReplay.cpp) ---------

class BusCommands {
  public:
    explicit BusCommands(const Options& options) : options_(options) {}

    // The connection, made on first use.
    QVReportingClient& client();
    void printBool(std::string_view op, std::int64_t id, bool result);
    int create(const std::string& id);
    int setType(const std::string& id, const std::string& type);
    int getType(const std::string& id);
    int configure(const std::string& id, const std::string& config);
    // Without --create the session would have to belong to this very connection, which is new:
    // the daemon then answers true at once. With it, the session is made here and held until
    // it is stopped by a signal, which stops it properly first.
    int start(const std::string& id, bool create, const std::string& type,
              const std::string& config);
    int send(const std::string& category, const std::string& type, const std::string& payload,
             const std::vector<std::string>& ids);
    int stop(const std::string& id);
    int destroy(const std::string& id);
    int valid(const std::string& id);
    int list();
    int kill();
    int stats();
    int notifyPost(const std::string& name, const std::string& text);
    int notifyGet(const std::string& name);
    int replay(const std::string& file);

  private:
    const Options& options_;
    std::unique_ptr<QVReportingClient> client_;
};

// --- Defaults (QVReportingCtlDefaults.cpp) -----------------------------------------------------

class DefaultsCommands {
  public:
    DefaultsCommands(const Options& options, BusCommands& bus);

    // Prints a suite, or one key of it, as JSON.
    int read(const std::string& suite, const std::string& key);
    // Sets a key to a JSON value.
    int write(const std::string& suite, const std::string& key, const std::string& text);
    // Removes a key, or every key of the suite when key is empty.
    int remove(const std::string& suite, const std::string& key);

  private:
    // The daemon rereads its own suite when told; a daemon that is not running reads it when it
    // starts, so that is not a failure.
    int tellDaemon(const std::string& suite);

    const Options& options_;
    BusCommands& bus_;
    LinuxPreferenceStore store_;
};

// --- Sinks (QVReportingCtlSinks.cpp) ------------------------------------------------------------

// Prints one sink, or every sink merged by time; with follow, keeps printing new lines.
int printSinks(const Options& options, const std::string& sink, bool follow);

// --- Report (QVReportingCtlReport.cpp; data and page in QVReportingCtlReport*.cpp) ---------------

struct ReportOptions {
    std::string since;  // seconds since 1970 or ISO 8601; empty: from the first line
    std::string until;  // the same, exclusive; empty: to the last line
    std::string application;
    std::string output;  // empty: report.html in the current directory
    bool summary = false;
};

// Writes the HTML report of the state directory's sinks, or with summary prints one line per
// session in aligned columns (one JSON document per session with --json).
int report(const Options& options, const ReportOptions& report);

// --- Fleet (QVReportingCtlFleet.cpp, built with the exporter) ----------------------------------

// Where the stream is: the exporter's options of the same names.
struct FleetOptions {
    std::string urls = "nats://127.0.0.1:4222";
    std::string creds;
    std::string nkey;
    std::string tlsCA;
    std::string stream = "QVREPORTING";
    std::string device;  // one device, or every one
    std::string sink;    // one sink, or every one
    bool follow = false;
};

// Prints the exporter's counters from export/status.json in the state directory.
int fleetStatus(const Options& options);
// Prints the stream's lines as `sinks` does, each with its device first; with follow, keeps
// printing new ones.
int fleetTail(const Options& options, const FleetOptions& fleet);
// Lists the devices in the stream with their last report time and each sink's last seq.
int fleetDevices(const Options& options, const FleetOptions& fleet);

// --- Captures (QVReportingCtlCaptures.cpp) -----------------------------------------------------

// Lists the issue captures of the state directory with their manifests, oldest first.
int printCaptures(const Options& options);

}  // namespace qv::ctl
