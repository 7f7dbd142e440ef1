// qvreportctl replay: a session script run on one connection.
#include <algorithm>
#include <condition_variable>
#include <deque>
#include <fstream>
#include <iostream>
#include <map>
#include <mutex>
#include <optional>
#include <thread>

#include <fmt/format.h>

#include "QVReportingCtl.h"
#include "QVReportingReplayScript.h"
#include "session/QVReportingVocabulary.h"

namespace qv::ctl {

namespace {

constexpr std::uint16_t kUnknownServiceType = 65535;
// How long a script's end waits for answers that it did not wait for on the way.
constexpr auto kLateAnswerWait = std::chrono::milliseconds(200);

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
                    endSessionAnd(op,
                                  [&] { return client_.createReportingSession(op.reporterID); });
                    serviceTypes_[op.reporterID] = kUnknownServiceType;
                    break;
                case Kind::SetType: {
                    // Only a new type replaces the session; the same type keeps it running.
                    const auto known = serviceTypes_.find(op.reporterID);
                    const bool replaces =
                        known != serviceTypes_.end() && known->second != op.serviceType;
                    const auto set = [&] {
                        return client_.setServiceType(op.serviceType, op.reporterID);
                    };
                    if (replaces) {
                        endSessionAnd(op, set);
                    } else {
                        report(op.line, name, op.reporterID, set());
                    }
                    if (known != serviceTypes_.end()) {
                        known->second = op.serviceType;
                    }
                    break;
                }
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
                case Kind::Stop:
                    endSessionAnd(op, [&] { return client_.stopReportingSession(op.reporterID); });
                    break;
                case Kind::Destroy:
                    endSessionAnd(op,
                                  [&] { return client_.destroyReportingSession(op.reporterID); });
                    serviceTypes_.erase(op.reporterID);
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

    // Runs an operation that ends the session's run (stop, destroy, or a create or set-type that
    // puts a new session in its place): the daemon answers a held start call of the session just
    // before the operation's own reply, so the answer is awaited and printed first.
    template <typename Call>
    void endSessionAnd(const Op& op, Call call) {
        const bool held = endSession(op.reporterID, op.line);
        const auto before = startAnswers(op.reporterID);
        report(op.line, qv::client::QVReportingReplayOperationName(op.kind), op.reporterID, call());
        if (held) {
            awaitStartReply(op.reporterID, before);
        }
    }

    // Whether the daemon holds a start call of this session: one made since the session's run
    // last ended here. Marks the run as ended.
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
    // Per session made by this script, its service type as set here (script thread only).
    std::map<std::int64_t, std::uint16_t> serviceTypes_;
};

}  // namespace

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

}  // namespace qv::ctl
