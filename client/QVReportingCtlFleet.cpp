// qvreportctl fleet: the exporter's counters (export/status.json), and the stream it fills read
// back: every device's sink lines, and the devices seen with their last report.
#include <fstream>
#include <iostream>
#include <map>
#include <memory>

#include <fmt/format.h>

#include "QVReportingCtl.h"
#include "QVReportingCtlSupport.h"
#include "QVReportingExportConnection.h"
#include "QVReportingExportFiles.h"

namespace qv::ctl {

namespace {

using qv::exporter::QVReportingExportNatsError;

// How long `tail` without --follow waits for a first line (none may match), and for the next
// one while the server says more are pending.
constexpr int kQuietMs = 2000;
constexpr int kStalledMs = 30000;
// New reading consumers made for one read that stalls before it ends.
constexpr int kStallRestarts = 2;
// JetStream requests (stream information, making the reading consumer): a cluster that has just
// lost a node answers slowly.
constexpr int kRequestWaitMs = 20000;
// A status file older than this means the exporter is not running (it writes every second).
constexpr double kStaleStatusSeconds = 10;

// Holds a connection and its JetStream context for one command.
class Stream {
  public:
    explicit Stream(const FleetOptions& fleet) : name_(fleet.stream) {
        qv::exporter::QVReportingExportServerSettings settings;
        settings.urls = fleet.urls;
        settings.credsFile = fleet.creds;
        settings.nkeyFile = fleet.nkey;
        settings.tlsCAFile = fleet.tlsCA;
        std::string error;
        options_.reset(qv::exporter::QVReportingExportNatsOptions(settings, "qvreportctl", error));
        if (!options_) {
            throw UsageError{error};
        }
        natsConnection* connection = nullptr;
        if (const natsStatus s = natsConnection_Connect(&connection, options_.get());
            s != NATS_OK) {
            throw Failure{"cannot connect to " + fleet.urls + ": " + QVReportingExportNatsError(s)};
        }
        connection_.reset(connection);
        jsOptions options;
        jsOptions_Init(&options);
        options.Wait = kRequestWaitMs;
        jsCtx* js = nullptr;
        if (const natsStatus s = natsConnection_JetStream(&js, connection, &options);
            s != NATS_OK) {
            throw Failure{"JetStream: " + QVReportingExportNatsError(s)};
        }
        js_.reset(js);
    }

    // Messages in the stream.
    std::uint64_t messages() const {
        jsStreamInfo* info = nullptr;
        jsErrCode code = static_cast<jsErrCode>(0);
        if (const natsStatus s = js_GetStreamInfo(&info, js_.get(), name_.c_str(), nullptr, &code);
            s != NATS_OK) {
            throw Failure{"stream " + name_ + ": " + QVReportingExportNatsError(s)};
        }
        const auto count = info->State.Msgs;
        jsStreamInfo_Destroy(info);
        return count;
    }

    // The subjects matching filter with their message counts, as the stream's leader has them.
    std::map<std::string, std::uint64_t> subjects(const std::string& filter) const {
        jsOptions options;
        jsOptions_Init(&options);
        options.Wait = kRequestWaitMs;
        options.Stream.Info.SubjectsFilter = filter.c_str();
        jsStreamInfo* info = nullptr;
        jsErrCode code = static_cast<jsErrCode>(0);
        if (const natsStatus s = js_GetStreamInfo(&info, js_.get(), name_.c_str(), &options, &code);
            s != NATS_OK) {
            throw Failure{"stream " + name_ + ": " + QVReportingExportNatsError(s)};
        }
        std::map<std::string, std::uint64_t> out;
        if (const auto* list = info->State.Subjects) {
            for (int i = 0; i < list->Count; ++i) {
                out[list->List[i].Subject] = list->List[i].Msgs;
            }
        }
        jsStreamInfo_Destroy(info);
        return out;
    }

    // Hands each message of the subjects matching filter to onMessage, in stream order, from
    // where policy says: for as long as the process runs with follow, else until expected
    // messages came and the server says none is left. The reading consumer may sit on a replica
    // still catching up, which counts none left before it has them all: expected (what the
    // leader holds; 0 when not known) is waited for. A consumer made while a cluster comes back
    // can stop short of what the leader holds; reading all of it then goes on with a new
    // consumer from the next message, a few times before giving up.
    template <typename OnMessage>
    void read(const std::string& filter, jsDeliverPolicy policy, bool follow,
              std::uint64_t expected, OnMessage&& onMessage) const {
        if (!follow && expected == 0 && messages() == 0) {
            return;
        }
        std::uint64_t nextStreamSeq = 0;  // after the last message delivered; 0: none yet
        auto subscribe = [&] {
            jsSubOptions sub;
            jsSubOptions_Init(&sub);
            sub.Stream = name_.c_str();
            sub.Config.DeliverPolicy = nextStreamSeq ? js_DeliverByStartSequence : policy;
            sub.Config.OptStartSeq = nextStreamSeq;
            sub.Ordered = true;  // no acknowledgements; the library starts it again after a gap
            natsSubscription* subscription = nullptr;
            jsErrCode code = static_cast<jsErrCode>(0);
            if (const natsStatus s = js_SubscribeSync(&subscription, js_.get(), filter.c_str(),
                                                      nullptr, &sub, &code);
                s != NATS_OK) {
                throw Failure{"cannot read " + name_ + ": " + QVReportingExportNatsError(s)};
            }
            return std::unique_ptr<natsSubscription, void (*)(natsSubscription*)>(
                subscription, natsSubscription_Destroy);
        };
        auto subscription = subscribe();
        int restarts = 0;
        std::uint64_t pending = 0;  // after the last message, as the server counted
        std::uint64_t delivered = 0;
        for (;;) {
            natsMsg* msg = nullptr;
            // A pause with lines still to come is a consumer being made again or a replica
            // catching up (a cluster that lost a node), and is waited out.
            const bool more = pending > 0 || delivered < expected;
            const int wait = more ? kStalledMs : kQuietMs;
            const natsStatus s = natsSubscription_NextMsg(&msg, subscription.get(), wait);
            if (s == NATS_TIMEOUT) {
                std::cout.flush();
                if (follow) {
                    continue;
                }
                if (more && policy == js_DeliverAll && restarts < kStallRestarts) {
                    ++restarts;
                    subscription.reset();
                    subscription = subscribe();
                    continue;
                }
                if (more) {
                    throw Failure{fmt::format("reading {} stalled after {} of {} lines", name_,
                                              delivered, expected)};
                }
                return;
            }
            if (s != NATS_OK) {
                throw Failure{"reading " + name_ + ": " + QVReportingExportNatsError(s)};
            }
            onMessage(msg);
            ++delivered;
            jsMsgMetaData* meta = nullptr;
            if (natsMsg_GetMetaData(&meta, msg) == NATS_OK) {
                pending = meta->NumPending;
                nextStreamSeq = meta->Sequence.Stream + 1;
            }
            jsMsgMetaData_Destroy(meta);
            natsMsg_Destroy(msg);
            if (pending == 0) {
                std::cout.flush();
                if (!follow && delivered >= expected) {
                    return;
                }
            }
        }
    }

  private:
    // Destroyed in reverse: the context, the connection, then its options.
    std::unique_ptr<natsOptions, void (*)(natsOptions*)> options_{nullptr, natsOptions_Destroy};
    std::unique_ptr<natsConnection, void (*)(natsConnection*)> connection_{nullptr,
                                                                           natsConnection_Destroy};
    std::unique_ptr<jsCtx, void (*)(jsCtx*)> js_{nullptr, jsCtx_Destroy};
    std::string name_;
};

// "qvreporting.DEVICE.SINK" -> (DEVICE, SINK).
bool splitSubject(std::string_view subject, std::string& device, std::string& sink) {
    constexpr std::string_view kPrefix = "qvreporting.";
    if (!subject.starts_with(kPrefix)) {
        return false;
    }
    subject.remove_prefix(kPrefix.size());
    const auto dot = subject.find('.');
    if (dot == std::string_view::npos || subject.find('.', dot + 1) != std::string_view::npos) {
        return false;
    }
    device = subject.substr(0, dot);
    sink = subject.substr(dot + 1);
    return true;
}

std::string filterFor(const FleetOptions& fleet) {
    return fmt::format("qvreporting.{}.{}", fleet.device.empty() ? "*" : fleet.device,
                       fleet.sink.empty() ? "*" : fleet.sink);
}

// A stream message as `sinks` prints a line, with its device first.
void printLine(const Options& options, natsMsg* msg) {
    std::string device, sink;
    if (!splitSubject(natsMsg_GetSubject(msg), device, sink)) {
        return;
    }
    const std::string_view data(natsMsg_GetData(msg),
                                static_cast<std::size_t>(natsMsg_GetDataLength(msg)));
    const std::string line = qv::client::QVReportingCtlFormatSinkLine(sink, data, options.json);
    if (!options.json) {
        std::cout << device << ' ' << line << '\n';
        return;
    }
    Json out = {{"device", device}};
    Json parsed = Json::parse(line);
    for (auto& [key, value] : parsed.items()) {
        out[key] = std::move(value);
    }
    std::cout << dump(out) << '\n';
}

}  // namespace

int fleetStatus(const Options& options) {
    const auto path = qv::exporter::QVReportingExportStatusPath(options.stateDir);
    std::ifstream in(path);
    const Json status = Json::parse(in, nullptr, false);
    if (!in.is_open()) {
        throw Failure{"no exporter status in " + path.string() +
                      " (qvreport-export writes it while it runs)"};
    }
    if (!status.is_object() || !status.contains("sinks")) {
        throw Failure{path.string() + " is not an exporter status"};
    }
    if (options.json) {
        emit(status);
        return 0;
    }
    const double updated = status.value("updated", 0.0);
    std::cout << fmt::format("device {} -> {} (stream {}): {}, stream {}\n",
                             status.value("device", ""), status.value("servers", ""),
                             status.value("stream", ""),
                             status.value("connected", false) ? "connected" : "not connected",
                             status.value("stream_ready", false) ? "ready" : "not ready");
    std::cout << "updated " << qv::client::QVReportingCtlFormatUTC(updated);
    if (now() - updated > kStaleStatusSeconds) {
        std::cout << fmt::format(" ({:.0f} s ago: is qvreport-export running?)", now() - updated);
    }
    std::cout << '\n';
    if (const auto error = status.value("last_error", ""); !error.empty()) {
        std::cout << "last error: " << error << '\n';
    }
    std::cout << fmt::format("{:<14}{:>10}{:>14}{:>12}{:>9}{:>8}{:>9}{:>12}{:>11}{:>13}\n", "sink",
                             "sent", "acknowledged", "duplicates", "retried", "failed", "expired",
                             "cursor", "lag_lines", "lag_seconds");
    for (const auto& [name, c] : status["sinks"].items()) {
        std::cout << fmt::format(
            "{:<14}{:>10}{:>14}{:>12}{:>9}{:>8}{:>9}{:>12}{:>11}{:>13.1f}\n", name,
            c.value("sent", 0ull), c.value("acknowledged", 0ull), c.value("duplicates", 0ull),
            c.value("retried", 0ull), c.value("failed", 0ull), c.value("expired", 0ull),
            c.value("cursor", 0ull), c.value("lag_lines", 0ull), c.value("lag_seconds", 0.0));
    }
    return 0;
}

int fleetTail(const Options& options, const FleetOptions& fleet) {
    if (!fleet.sink.empty() && !qv::client::QVReportingCtlIsSinkName(fleet.sink)) {
        throw UsageError{"not a sink name: " + fleet.sink};
    }
    const Stream stream(fleet);
    const std::string filter = filterFor(fleet);
    std::uint64_t expected = 0;
    if (!fleet.follow) {
        for (const auto& [subject, count] : stream.subjects(filter)) {
            expected += count;
        }
    }
    stream.read(filter, js_DeliverAll, fleet.follow, expected,
                [&](natsMsg* msg) { printLine(options, msg); });
    return 0;
}

int fleetDevices(const Options& options, const FleetOptions& fleet) {
    struct Device {
        double lastReport = 0;
        std::map<std::string, std::uint64_t> lastSeqs;  // per sink
    };
    std::map<std::string, Device> devices;
    // The last line of each device's sinks says when it last reported and how far each got.
    const Stream stream(fleet);
    const std::string filter = "qvreporting.*.*";
    stream.read(
        filter, js_DeliverLastPerSubject, false, stream.subjects(filter).size(), [&](natsMsg* msg) {
            std::string device, sink;
            if (!splitSubject(natsMsg_GetSubject(msg), device, sink)) {
                return;
            }
            auto& seen = devices[device];
            const Json line =
                Json::parse(std::string_view(natsMsg_GetData(msg),
                                             static_cast<std::size_t>(natsMsg_GetDataLength(msg))),
                            nullptr, false);
            if (!line.is_object()) {
                return;
            }
            if (line.contains("time") && line["time"].is_number()) {
                seen.lastReport = std::max(seen.lastReport, line["time"].get<double>());
            }
            seen.lastSeqs[sink] = line.contains("seq") && line["seq"].is_number_unsigned()
                                      ? line["seq"].get<std::uint64_t>()
                                      : 0;
        });
    for (const auto& [device, seen] : devices) {
        if (options.json) {
            emit({{"device", device}, {"last_report", seen.lastReport}, {"sinks", seen.lastSeqs}});
            continue;
        }
        std::string sinks;
        for (const auto& [sink, seq] : seen.lastSeqs) {
            sinks += fmt::format("{}{} {}", sinks.empty() ? "" : ", ", sink, seq);
        }
        std::cout << device << "  last report "
                  << qv::client::QVReportingCtlFormatUTC(seen.lastReport) << "  last seq: " << sinks
                  << '\n';
    }
    return 0;
}

}  // namespace qv::ctl
