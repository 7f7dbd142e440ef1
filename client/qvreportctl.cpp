// qvreportctl: the audio reporting daemon's command-line client. Every bus operation, session
// scripts, the defaults store, named notifications, the guardrail counters and the sink files.
//
// Exit status: 0 done; 1 a call or file operation failed; 2 bad arguments or input; 3 the daemon
// is not running on the chosen bus. Messages for people go to standard error; with --json,
// results go to standard output as one JSON document per line.

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <csignal>
#include <cstdio>
#include <deque>
#include <fstream>
#include <future>
#include <iostream>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include <fmt/format.h>
#include <CLI/CLI.hpp>
#include <nlohmann/json.hpp>

#include "QVReportingClient.h"
#include "QVReportingCtlSupport.h"
#include "QVReportingJsonVariant.h"
#include "QVReportingReplayScript.h"
#include "platform/linux/LinuxPreferenceStore.h"
#include "service/QVReportingDBusNames.h"
#include "session/QVReportingVocabulary.h"
#include "values/ValueJson.h"

namespace {

using qv::client::QVReportingClient;
using qv::client::QVReportingClientError;
using qv::client::VariantMap;
using Json = nlohmann::ordered_json;

constexpr int kExitFailed = 1;
constexpr int kExitUsage = 2;
constexpr int kExitNotRunning = 3;

// The suite whose "device_name" the daemon watches, and the notification that tells it to look.
constexpr const char* kDaemonSuite = "com.korvane.qvsound";
constexpr const char* kDaemonSuiteChanged = "com.korvane.qvsound.reporting";

// How long a script waits, after stopping a session, for that session's held start reply.
constexpr auto kStartReplyWait = std::chrono::seconds(5);
// How long a script's end waits for answers that it did not wait for on the way.
constexpr auto kLateAnswerWait = std::chrono::milliseconds(200);
constexpr auto kFollowInterval = std::chrono::milliseconds(100);

// A problem with what the user gave us (exit 2), as opposed to a failed call (exit 1).
struct UsageError {
    std::string message;
};
struct Failure {
    std::string message;
};

struct Options {
    std::string bus = "system";
    std::string stateDir;
    bool json = false;
};

std::string dump(const Json& json, int indent = -1) {
    return json.dump(indent, ' ', false, Json::error_handler_t::replace);
}

void emit(const Json& json) {
    std::cout << dump(json) << std::endl;
}

double now() {
    using namespace std::chrono;
    return duration<double>(system_clock::now().time_since_epoch()).count();
}

std::int64_t reporterID(const std::string& text) {
    auto id = qv::client::QVReportingCtlParseReporterID(text);
    if (!id) {
        throw UsageError{"not a reporter ID (a signed 64-bit integer): " + text};
    }
    return *id;
}

Json parseJson(const std::string& text, const std::string& what) {
    Json json = Json::parse(text, nullptr, false);
    if (json.is_discarded()) {
        throw UsageError{what + " is not valid JSON: " + text +
                         " (strings need quotes: '\"text\"')"};
    }
    return json;
}

VariantMap variantMap(const std::string& text, const std::string& what) {
    qv::client::QVReportingJsonConversionOptions options;
    options.now = now();
    try {
        return qv::client::QVReportingJsonToVariantMap(parseJson(text, what), options, what);
    } catch (const qv::client::QVReportingJsonConversionError& e) {
        throw UsageError{e.what()};
    }
}

std::string serviceTypeText(std::uint16_t serviceType) {
    return fmt::format("{} ({})", serviceType,
                       qv::QVReportingUtilityGenerateServiceNameFromServiceType(serviceType));
}

std::string idsText(const std::vector<std::int64_t>& ids) {
    return ids.empty() ? "all started sessions" : fmt::format("[{}]", fmt::join(ids, ", "));
}

// --- Bus commands ---------------------------------------------------------------------------

class BusCommands {
  public:
    explicit BusCommands(const Options& options) : options_(options) {}

    QVReportingClient& client() {
        if (!client_) {
            client_ = QVReportingClient::connect(options_.bus);
        }
        return *client_;
    }

    void printBool(std::string_view op, std::int64_t id, bool result) {
        if (options_.json) {
            emit({{"op", op}, {"id", id}, {"result", result}});
        } else {
            std::cout << fmt::format("{} {}: {}", op, id, result) << std::endl;
        }
    }

    int create(const std::string& id) {
        const auto rid = reporterID(id);
        printBool("create", rid, client().createReportingSession(rid));
        return 0;
    }

    int setType(const std::string& id, const std::string& type) {
        const auto rid = reporterID(id);
        const auto serviceType = qv::client::QVReportingCtlParseServiceType(type);
        if (!serviceType) {
            throw UsageError{
                "not a service type (a number up to 65535 or a name such as "
                "longformaudio): " +
                type};
        }
        printBool("set-type", rid, client().setServiceType(*serviceType, rid));
        return 0;
    }

    int getType(const std::string& id) {
        const auto rid = reporterID(id);
        const auto serviceType = client().getServiceNameForReporterID(rid);
        if (options_.json) {
            emit({{"op", "get-type"},
                  {"id", rid},
                  {"serviceType", serviceType},
                  {"serviceName",
                   qv::QVReportingUtilityGenerateServiceNameFromServiceType(serviceType)}});
        } else {
            std::cout << fmt::format("service type of {}: {}", rid, serviceTypeText(serviceType))
                      << std::endl;
        }
        return 0;
    }

    int configure(const std::string& id, const std::string& config) {
        const auto rid = reporterID(id);
        const auto configuration = variantMap(config, "config");
        printBool("configure", rid, client().setConfiguration(configuration, rid));
        return 0;
    }

    // Without --create the session would have to belong to this very connection, which is new:
    // the daemon then answers true at once. With it, the session is made here and held until
    // it is stopped by a signal, which stops it properly first.
    int start(const std::string& id, bool create, const std::string& type,
              const std::string& config) {
        const auto rid = reporterID(id);
        std::optional<std::uint16_t> serviceType;
        if (!type.empty()) {
            serviceType = qv::client::QVReportingCtlParseServiceType(type);
            if (!serviceType) {
                throw UsageError{"not a service type: " + type};
            }
        }
        std::optional<VariantMap> configuration;
        if (!config.empty()) {
            configuration = variantMap(config, "config");
        }
        create = create || serviceType || configuration;

        // Signals wait for sigtimedwait below; blocked before the client's thread exists, so
        // that thread inherits the mask and never takes them.
        sigset_t signals;
        sigemptyset(&signals);
        sigaddset(&signals, SIGINT);
        sigaddset(&signals, SIGTERM);
        pthread_sigmask(SIG_BLOCK, &signals, nullptr);

        auto& c = client();
        if (create) {
            c.createReportingSession(rid);
            if (serviceType) {
                c.setServiceType(*serviceType, rid);
            }
            if (configuration) {
                c.setConfiguration(*configuration, rid);
            }
        }
        auto promise = std::make_shared<std::promise<std::optional<QVReportingClientError>>>();
        auto answered = promise->get_future();
        c.startReportingSessionAsync(rid, [promise](const QVReportingClientError* error, bool) {
            promise->set_value(error ? std::optional(*error) : std::nullopt);
        });
        if (create && !options_.json) {
            std::cerr << fmt::format("session {} started; Ctrl-C stops it", rid) << std::endl;
        }
        bool stopped = false;
        while (answered.wait_for(std::chrono::seconds(0)) != std::future_status::ready) {
            timespec interval{0, 100'000'000};
            if (sigtimedwait(&signals, nullptr, &interval) > 0 && !stopped) {
                stopped = true;
                c.stopReportingSession(rid);
                if (answered.wait_for(kStartReplyWait) != std::future_status::ready) {
                    throw Failure{"the session stopped but its start call was never answered"};
                }
            }
        }
        if (auto error = answered.get()) {
            throw *error;
        }
        if (create) {
            c.destroyReportingSession(rid);
        }
        printBool("start", rid, true);
        return 0;
    }

    int send(const std::string& category, const std::string& type, const std::string& payload,
             const std::vector<std::string>& ids) {
        const auto cat = qv::client::QVReportingCtlParseCategory(category);
        if (!cat) {
            throw UsageError{
                "not a category (a number or a name such as Playback or "
                "DSP_Setup): " +
                category};
        }
        const auto typ = qv::client::QVReportingCtlParseType(type);
        if (!typ) {
            throw UsageError{
                "not an event type (a number up to 65535 or a name such as "
                "Start): " +
                type};
        }
        std::vector<std::int64_t> rids;
        for (const auto& id : ids) {
            rids.push_back(reporterID(id));
        }
        client().sendMessage(variantMap(payload, "payload"), *cat, *typ, rids);
        if (options_.json) {
            emit({{"op", "send"}, {"category", *cat}, {"type", *typ}, {"ids", rids}});
        } else {
            std::cout << fmt::format("sent {}/{} to {}", qv::QVReportingUtilityCategoryString(*cat),
                                     qv::QVReportingUtilityTypeString(*typ), idsText(rids))
                      << std::endl;
        }
        return 0;
    }

    int stop(const std::string& id) {
        const auto rid = reporterID(id);
        printBool("stop", rid, client().stopReportingSession(rid));
        return 0;
    }

    int destroy(const std::string& id) {
        const auto rid = reporterID(id);
        printBool("destroy", rid, client().destroyReportingSession(rid));
        return 0;
    }

    int valid(const std::string& id) {
        const auto rid = reporterID(id);
        const Json reply = qv::client::QVReportingVariantMapToJson(client().reporterIDValid(rid));
        if (options_.json) {
            emit({{"op", "valid"}, {"id", rid}, {"result", reply}});
            return 0;
        }
        const auto found = reply.value(qv::dbus::kReporterProxyKeyReporterID, Json(0));
        const auto serviceType = reply.value(qv::dbus::kReporterProxyKeyServiceType, Json(65535));
        if (found == 0) {
            std::cout << fmt::format("reporter {}: unknown", rid) << std::endl;
        } else {
            std::cout << fmt::format("reporter {}: service type {}", rid,
                                     serviceType.is_number_unsigned()
                                         ? serviceTypeText(serviceType.get<std::uint16_t>())
                                         : dump(serviceType))
                      << std::endl;
        }
        return 0;
    }

    int list() {
        const auto ids = client().getAllReporters();
        if (options_.json) {
            emit({{"op", "list"}, {"result", ids}});
        } else {
            for (auto id : ids) {
                std::cout << id << '\n';
            }
            std::cout.flush();
        }
        return 0;
    }

    int kill() {
        client().killService();
        if (options_.json) {
            emit({{"op", "kill"}, {"result", true}});
        } else {
            std::cout << "the daemon has exited" << std::endl;
        }
        return 0;
    }

    int stats() {
        const Json stats = qv::client::QVReportingVariantMapToJson(client().getStats());
        if (options_.json) {
            emit(stats);
            return 0;
        }
        for (const auto& [key, value] : stats.items()) {
            std::cout << key << ": " << dump(value) << '\n';
        }
        std::cout.flush();
        return 0;
    }

    int notifyPost(const std::string& name, const std::string& text) {
        const auto state = qv::client::QVReportingCtlParseUnsigned(text);
        if (!state) {
            throw UsageError{"not a state (an unsigned 64-bit number): " + text};
        }
        client().postNotification(name, *state);
        if (options_.json) {
            emit({{"op", "notify-post"}, {"name", name}, {"state", *state}});
        } else {
            std::cout << fmt::format("posted {} = {}", name, *state) << std::endl;
        }
        return 0;
    }

    int notifyGet(const std::string& name) {
        const auto state = client().getNotificationState(name);
        if (options_.json) {
            emit({{"op", "notify-get"}, {"name", name}, {"state", state}});
        } else {
            std::cout << state << std::endl;
        }
        return 0;
    }

    int replay(const std::string& file);

  private:
    const Options& options_;
    std::unique_ptr<QVReportingClient> client_;
};

// --- Session scripts --------------------------------------------------------------------------

// Runs a parsed script on one connection. Start replies arrive on the client's thread; they are
// queued and printed by the script's thread between operations, so output keeps one order.
class ReplayRunner {
  public:
    ReplayRunner(QVReportingClient& client, bool json) : client_(client), json_(json) {}

    int run(const std::vector<qv::client::QVReportingReplayOperation>& operations) {
        for (const auto& op : operations) {
            runOne(op);
            printArrivedStarts();
        }
        {
            // An answer that was not waited for (a start before a same-type set-type, say)
            // may still be on its way.
            std::unique_lock lock(shared_->mutex);
            if (!shared_->pending.empty()) {
                shared_->changed.wait_for(lock, kLateAnswerWait,
                                          [&] { return !shared_->arrived.empty(); });
            }
        }
        printArrivedStarts();
        std::lock_guard lock(shared_->mutex);
        for (const auto& [id, lines] : shared_->pending) {
            for (auto line : lines) {
                report(line, "start", id,
                       "never answered: the session was still running, or was already started, "
                       "when the script ended",
                       true);
            }
        }
        return 0;
    }

  private:
    using Op = qv::client::QVReportingReplayOperation;
    using Kind = Op::Kind;

    struct StartReply {
        std::int64_t id;
        std::size_t line;
        std::optional<QVReportingClientError> error;
        bool result;
    };
    struct Shared {
        std::mutex mutex;
        std::condition_variable changed;
        std::deque<StartReply> arrived;                           // guarded by mutex
        std::map<std::int64_t, std::deque<std::size_t>> pending;  // lines; guarded by mutex
        std::map<std::int64_t, std::size_t> answers;  // start answers so far; guarded by mutex
    };

    // One line of output; a pending start has no result yet (for people, result says why).
    void report(std::size_t line, std::string_view op, std::optional<std::int64_t> id,
                const Json& result, bool pending = false) {
        if (json_) {
            Json out = {{"line", line}, {"op", op}};
            if (id) {
                out["id"] = *id;
            }
            if (pending) {
                out["pending"] = true;
            } else {
                out["result"] = result;
            }
            emit(out);
            return;
        }
        std::string text = fmt::format("line {}: {}", line, op);
        if (id) {
            text += fmt::format(" {}", *id);
        }
        text += ": " + (result.is_string() ? result.get<std::string>() : dump(result));
        std::cout << text << std::endl;
    }

    VariantMap dictionary(const Op& op, const char* what) {
        qv::client::QVReportingJsonConversionOptions options;
        options.now = now();
        return qv::client::QVReportingJsonToVariantMap(op.dictionary, options, what);
    }

    void runOne(const Op& op) {
        const auto name = qv::client::QVReportingReplayOperationName(op.kind);
        try {
            switch (op.kind) {
                case Kind::Create:
                    endSession(op.reporterID, op.line);
                    report(op.line, name, op.reporterID,
                           client_.createReportingSession(op.reporterID));
                    break;
                case Kind::SetType:
                    endSession(op.reporterID, op.line);
                    report(op.line, name, op.reporterID,
                           client_.setServiceType(op.serviceType, op.reporterID));
                    break;
                case Kind::GetType: {
                    const auto serviceType = client_.getServiceNameForReporterID(op.reporterID);
                    report(op.line, name, op.reporterID,
                           json_ ? Json(serviceType) : Json(serviceTypeText(serviceType)));
                    break;
                }
                case Kind::Configure:
                    report(op.line, name, op.reporterID,
                           client_.setConfiguration(dictionary(op, "config"), op.reporterID));
                    break;
                case Kind::Start:
                    start(op);
                    break;
                case Kind::Send:
                    client_.sendMessage(dictionary(op, "payload"), op.category, op.type,
                                        op.reporterIDs);
                    report(op.line, name, std::nullopt,
                           json_
                               ? Json{{"category", op.category},
                                      {"type", op.type},
                                      {"ids", op.reporterIDs}}
                               : Json(fmt::format("{}/{} to {}",
                                                  qv::QVReportingUtilityCategoryString(op.category),
                                                  qv::QVReportingUtilityTypeString(op.type),
                                                  idsText(op.reporterIDs))));
                    break;
                case Kind::Stop: {
                    const bool held = endSession(op.reporterID, op.line);
                    const auto before = startAnswers(op.reporterID);
                    report(op.line, name, op.reporterID,
                           client_.stopReportingSession(op.reporterID));
                    if (held) {
                        awaitStartReply(op.reporterID, before);
                    }
                    break;
                }
                case Kind::Destroy:
                    // Destroying stops a started session without answering its start call.
                    endSession(op.reporterID, op.line);
                    report(op.line, name, op.reporterID,
                           client_.destroyReportingSession(op.reporterID));
                    break;
                case Kind::Valid:
                    report(op.line, name, op.reporterID,
                           qv::client::QVReportingVariantMapToJson(
                               client_.reporterIDValid(op.reporterID)));
                    break;
                case Kind::List:
                    report(op.line, name, std::nullopt, Json(client_.getAllReporters()));
                    break;
                case Kind::Sleep:
                    std::this_thread::sleep_for(std::chrono::duration<double>(op.seconds));
                    report(op.line, name, std::nullopt,
                           json_ ? Json(op.seconds) : Json(fmt::format("{} s", op.seconds)));
                    break;
            }
        } catch (const QVReportingClientError& e) {
            throw QVReportingClientError(
                e.name(), fmt::format("line {}: {} failed: {}", op.line, name, e.message()));
        }
    }

    void start(const Op& op) {
        {
            std::lock_guard lock(shared_->mutex);
            shared_->pending[op.reporterID].push_back(op.line);
        }
        client_.startReportingSessionAsync(
            op.reporterID, [shared = shared_, id = op.reporterID, line = op.line](
                               const QVReportingClientError* error, bool result) {
                std::lock_guard lock(shared->mutex);
                auto& lines = shared->pending[id];
                if (auto it = std::find(lines.begin(), lines.end(), line); it != lines.end()) {
                    lines.erase(it);
                }
                if (lines.empty()) {
                    shared->pending.erase(id);
                }
                ++shared->answers[id];
                shared->arrived.push_back(
                    {id, line, error ? std::optional(*error) : std::nullopt, result});
                shared->changed.notify_all();
            });
        report(op.line, "start", op.reporterID,
               "waiting for the reply (held until the session stops)", true);
    }

    // Whether the daemon holds a start call of this session: one made since the session was last
    // stopped, destroyed or replaced (create, and set-type when the type changes, put a new
    // session in its place, dropping a held call unanswered). Marks the session as ended here.
    bool endSession(std::int64_t id, std::size_t line) {
        std::size_t& boundary = sessionBoundaries_[id];
        bool held = false;
        {
            std::lock_guard lock(shared_->mutex);
            if (auto it = shared_->pending.find(id); it != shared_->pending.end()) {
                held = std::any_of(it->second.begin(), it->second.end(),
                                   [&](std::size_t l) { return l > boundary; });
            }
        }
        boundary = line;
        return held;
    }

    // The number of answers to start calls of a session so far.
    std::size_t startAnswers(std::int64_t id) {
        std::lock_guard lock(shared_->mutex);
        auto it = shared_->answers.find(id);
        return it == shared_->answers.end() ? 0 : it->second;
    }

    // A stopped session answers its held start call just before the stop reply; the answer may
    // still be on its way through the client's thread, or may have come already (answers then
    // moved past before). A start call made while the session was already started is never
    // answered, so this waits for one answer, not for all, and only while one is outstanding.
    void awaitStartReply(std::int64_t id, std::size_t before) {
        std::unique_lock lock(shared_->mutex);
        shared_->changed.wait_for(lock, kStartReplyWait,
                                  [&] { return shared_->answers[id] > before; });
        lock.unlock();
        printArrivedStarts();
    }

    void printArrivedStarts() {
        std::deque<StartReply> arrived;
        {
            std::lock_guard lock(shared_->mutex);
            arrived.swap(shared_->arrived);
        }
        for (const auto& reply : arrived) {
            if (reply.error) {
                throw QVReportingClientError(
                    reply.error->name(),
                    fmt::format("line {}: start failed: {}", reply.line, reply.error->message()));
            }
            report(reply.line, "start", reply.id,
                   json_ ? Json(reply.result) : Json(fmt::format("answered {}", reply.result)));
        }
    }

    QVReportingClient& client_;
    const bool json_;
    std::shared_ptr<Shared> shared_ = std::make_shared<Shared>();
    // Per session, the line that last stopped, destroyed or replaced it (script thread only).
    std::map<std::int64_t, std::size_t> sessionBoundaries_;
};

int BusCommands::replay(const std::string& file) {
    std::ifstream stream;
    std::istream* in = &std::cin;
    if (file != "-") {
        stream.open(file);
        if (!stream) {
            throw Failure{"cannot open " + file};
        }
        in = &stream;
    }
    auto parsed = qv::client::QVReportingParseReplayScript(*in);
    if (auto* error = std::get_if<qv::client::QVReportingReplayError>(&parsed)) {
        throw UsageError{fmt::format("{}:{}: {}", file, error->line, error->message)};
    }
    ReplayRunner runner(client(), options_.json);
    return runner.run(std::get<0>(parsed));
}

// --- Defaults ---------------------------------------------------------------------------------

class DefaultsCommands {
  public:
    DefaultsCommands(const Options& options, BusCommands& bus)
        : options_(options), bus_(bus), store_(options.stateDir, [](const std::string& message) {
              std::cerr << "qvreportctl: defaults: " << message << std::endl;
          }) {}

    int read(const std::string& suite, const std::string& key) {
        if (key.empty()) {
            const Json values = qv::QVReportingDictionaryToJson(store_.values(suite));
            std::cout << (options_.json ? dump(values) : dump(values, 2)) << std::endl;
            return 0;
        }
        auto value = store_.value(suite, key);
        if (!value) {
            throw Failure{fmt::format("no key \"{}\" in {}", key, store_.pathForSuite(suite))};
        }
        std::cout << dump(qv::QVReportingValueToJson(*value)) << std::endl;
        return 0;
    }

    int write(const std::string& suite, const std::string& key, const std::string& text) {
        const Json json = parseJson(text, "the value");
        if (json.is_null()) {
            throw UsageError{"null cannot be stored; use `defaults delete` to remove a key"};
        }
        if (!store_.setValue(suite, key, qv::QVReportingValueFromJson(json))) {
            throw Failure{"could not write " + store_.pathForSuite(suite)};
        }
        return tellDaemon(suite);
    }

    int remove(const std::string& suite, const std::string& key) {
        std::vector<std::string> keys;
        if (key.empty()) {
            for (const auto& [k, v] : store_.values(suite)) {
                keys.push_back(k);
            }
        } else {
            if (!store_.value(suite, key)) {
                throw Failure{fmt::format("no key \"{}\" in {}", key, store_.pathForSuite(suite))};
            }
            keys.push_back(key);
        }
        for (const auto& k : keys) {
            if (!store_.removeValue(suite, k)) {
                throw Failure{"could not write " + store_.pathForSuite(suite)};
            }
        }
        return tellDaemon(suite);
    }

  private:
    // The daemon rereads its own suite when told; a daemon that is not running reads it when it
    // starts, so that is not a failure.
    int tellDaemon(const std::string& suite) {
        if (suite != kDaemonSuite) {
            return 0;
        }
        try {
            bus_.client().postNotification(kDaemonSuiteChanged, 0);
        } catch (const QVReportingClientError& e) {
            if (e.isDaemonNotRunning()) {
                std::cerr << "qvreportctl: saved; the daemon is not running and will read the "
                             "change when it starts"
                          << std::endl;
                return 0;
            }
            throw Failure{"saved, but telling the daemon failed: " + e.message()};
        }
        return 0;
    }

    const Options& options_;
    BusCommands& bus_;
    qv::LinuxPreferenceStore store_;
};

// --- Sinks ------------------------------------------------------------------------------------

int printSinks(const Options& options, const std::string& sink, bool follow) {
    if (!sink.empty() && !qv::client::QVReportingCtlIsSinkName(sink)) {
        throw UsageError{"not a sink name: " + sink};
    }
    const auto sinkNames = [&] {
        return sink.empty() ? qv::client::QVReportingCtlListSinks(options.stateDir)
                            : std::vector<std::string>{sink};
    };
    std::map<std::string, qv::client::QVReportingSinkTail> tails;
    const auto addTails = [&] {
        for (const auto& name : sinkNames()) {
            tails.try_emplace(name, qv::client::QVReportingCtlSinkPath(options.stateDir, name));
        }
    };
    addTails();
    if (!follow) {
        if (!sink.empty() &&
            !std::filesystem::exists(qv::client::QVReportingCtlSinkPath(options.stateDir, sink))) {
            throw Failure{"no sink file " +
                          qv::client::QVReportingCtlSinkPath(options.stateDir, sink)};
        }
        if (tails.empty()) {
            std::cerr << "qvreportctl: no sink files in " << options.stateDir << "/sinks"
                      << std::endl;
            return 0;
        }
        // Several files are merged by time, so one session's lines read in order.
        struct Line {
            double time;
            std::string text;
        };
        std::vector<Line> lines;
        for (auto& [name, tail] : tails) {
            for (auto& raw : tail.readNewLines()) {
                const Json parsed = Json::parse(raw, nullptr, false);
                const double time =
                    parsed.is_object() && parsed.contains("time") && parsed["time"].is_number()
                        ? parsed["time"].get<double>()
                        : 0.0;
                lines.push_back(
                    {time, qv::client::QVReportingCtlFormatSinkLine(name, raw, options.json)});
            }
        }
        std::stable_sort(lines.begin(), lines.end(),
                         [](const Line& a, const Line& b) { return a.time < b.time; });
        for (const auto& line : lines) {
            std::cout << line.text << '\n';
        }
        std::cout.flush();
        return 0;
    }
    for (;;) {
        addTails();  // sinks that appear while following are picked up
        bool any = false;
        for (auto& [name, tail] : tails) {
            for (auto& raw : tail.readNewLines()) {
                std::cout << qv::client::QVReportingCtlFormatSinkLine(name, raw, options.json)
                          << '\n';
                any = true;
            }
        }
        if (any) {
            std::cout.flush();
        }
        std::this_thread::sleep_for(kFollowInterval);
    }
}

// --- Command line -----------------------------------------------------------------------------

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

    c = app.add_subcommand("sinks", "Print the sink files (MTX records decoded as hex)");
    c->add_option("NAME", sink, "One sink (analytics, mtx, ...); default: all, merged by time");
    c->add_flag("-f,--follow", follow, "Keep printing lines as they are appended");
    c->callback([&] { action = [&] { return printSinks(options, sink, follow); }; });

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
