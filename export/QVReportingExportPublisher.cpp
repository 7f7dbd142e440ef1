#include "QVReportingExportPublisher.h"

#include <algorithm>
#include <charconv>
#include <cstdio>

#include <nats/nats.h>

namespace qv::exporter {

namespace {

constexpr const char* kSubjects = "qvreporting.>";
constexpr const char* kMessageIDHeader = "Nats-Msg-Id";
// Reconnect back-off: doubling from the first delay up to the last, as long as it takes.
constexpr std::int64_t kFirstReconnectDelayMs = 100;
constexpr std::int64_t kLongestReconnectDelayMs = 2000;
constexpr std::int64_t kCloseWaitMs = 5000;

std::int64_t reconnectDelay(natsConnection*, int attempts, void*) {
    const int doublings = std::clamp(attempts - 1, 0, 16);
    return std::min(kFirstReconnectDelayMs << doublings, kLongestReconnectDelayMs);
}

}  // namespace

struct QVReportingExportPublisher::Library {
    natsOptions* options = nullptr;
    natsConnection* connection = nullptr;
    jsCtx* js = nullptr;

    ~Library() {
        jsCtx_Destroy(js);
        natsConnection_Destroy(connection);
        natsOptions_Destroy(options);
    }
};

namespace {

// The publisher behind the library's void* closures.
QVReportingExportPublisher::Callbacks& callbacksOf(void* closure) {
    return *static_cast<QVReportingExportPublisher::Callbacks*>(closure);
}

void onConnected(natsConnection*, void* closure) {
    if (auto& callbacks = callbacksOf(closure); callbacks.connection) {
        callbacks.connection(true);
    }
}

void onDisconnected(natsConnection*, void* closure) {
    if (auto& callbacks = callbacksOf(closure); callbacks.connection) {
        callbacks.connection(false);
    }
}

// "DEVICE.SINK.SEQ" -> (SINK, SEQ); the device is ours.
bool parseMessageID(std::string_view id, std::string_view& sink, std::uint64_t& seq) {
    const auto lastDot = id.rfind('.');
    if (lastDot == std::string_view::npos || lastDot == 0) {
        return false;
    }
    const auto seqText = id.substr(lastDot + 1);
    const auto [end, error] = std::from_chars(seqText.data(), seqText.data() + seqText.size(), seq);
    if (error != std::errc() || end != seqText.data() + seqText.size()) {
        return false;
    }
    const auto firstDot = id.find('.');
    if (firstDot == lastDot) {
        return false;
    }
    sink = id.substr(firstDot + 1, lastDot - firstDot - 1);
    return true;
}

void onAck(jsCtx*, natsMsg* msg, jsPubAck* ack, jsPubAckErr* error, void* closure) {
    auto& callbacks = callbacksOf(closure);
    const char* id = nullptr;
    std::string_view sink;
    std::uint64_t seq = 0;
    if (natsMsgHeader_Get(msg, kMessageIDHeader, &id) == NATS_OK && id &&
        parseMessageID(id, sink, seq)) {
        if (ack && ack->Duplicate && ack->Sequence == 0) {
            // The stream's leader has the ID from a publication it has not stored yet: that one
            // is lost if the leader goes before it is, so this is no proof; sent again later.
            callbacks.failed(sink, seq, "a duplicate of a line the stream has not stored yet");
        } else if (ack) {
            callbacks.acknowledged(sink, seq, ack->Sequence, ack->Duplicate);
        } else {
            std::string text =
                error ? QVReportingExportNatsError(error->Err) : "no acknowledgement";
            if (error && error->ErrText) {
                text = error->ErrText;
            }
            callbacks.failed(sink, seq, text);
        }
    }
    natsMsg_Destroy(msg);
}

}  // namespace

QVReportingExportPublisher::QVReportingExportPublisher(QVReportingExportServerSettings settings,
                                                       std::string device, Callbacks callbacks)
    : nats_(std::make_unique<Library>()),
      settings_(std::move(settings)),
      device_(std::move(device)),
      callbacks_(std::move(callbacks)) {}

QVReportingExportPublisher::~QVReportingExportPublisher() {
    if (nats_->connection) {
        natsConnection_Close(nats_->connection);
    }
    nats_.reset();
    // The library calls back from its own threads (the connection's last "disconnected" among
    // them) after the close returns; they are waited for while the callbacks still exist.
    nats_CloseAndWait(kCloseWaitMs);
}

std::string QVReportingExportPublisher::start() {
    std::string error;
    nats_->options = QVReportingExportNatsOptions(settings_, "qvreport-export", error);
    if (!nats_->options) {
        return error;
    }
    natsOptions* o = nats_->options;
    const auto step = [&](natsStatus status, const char* what) {
        if (error.empty() && status != NATS_OK) {
            error = std::string(what) + ": " + QVReportingExportNatsError(status);
        }
    };
    // Reconnects for as long as it takes; lines wait in their segments meanwhile.
    step(natsOptions_SetMaxReconnect(o, -1), "reconnect");
    step(natsOptions_SetCustomReconnectDelay(o, reconnectDelay, nullptr), "reconnect delay");
    step(natsOptions_SetRetryOnFailedConnect(o, true, onConnected, &callbacks_), "retry");
    step(natsOptions_SetDisconnectedCB(o, onDisconnected, &callbacks_), "disconnected");
    step(natsOptions_SetReconnectedCB(o, onConnected, &callbacks_), "reconnected");
    if (!error.empty()) {
        return error;
    }
    const natsStatus connected = natsConnection_Connect(&nats_->connection, o);
    if (connected != NATS_OK && connected != NATS_NOT_YET_CONNECTED) {
        return "cannot connect to " + settings_.urls + ": " + QVReportingExportNatsError(connected);
    }
    if (connected == NATS_OK) {
        onConnected(nats_->connection, &callbacks_);
    }
    jsOptions js;
    jsOptions_Init(&js);
    js.PublishAsync.AckHandler = onAck;
    js.PublishAsync.AckHandlerClosure = &callbacks_;
    const natsStatus context = natsConnection_JetStream(&nats_->js, nats_->connection, &js);
    if (context != NATS_OK) {
        return "JetStream: " + QVReportingExportNatsError(context);
    }
    return {};
}

bool QVReportingExportPublisher::connected() const {
    return nats_->connection &&
           natsConnection_Status(nats_->connection) == NATS_CONN_STATUS_CONNECTED;
}

namespace {

// What a replicated stream lacks before it is written to: a leader, or a replica that is current.
std::string unsettledPart(const jsStreamInfo& info) {
    const jsClusterInfo* cluster = info.Cluster;
    if (!cluster) {
        return {};
    }
    if (!cluster->Leader || !*cluster->Leader) {
        return "a leader";
    }
    for (int i = 0; i < cluster->ReplicasLen; ++i) {
        const jsPeerInfo* peer = cluster->Replicas[i];
        if (peer->Offline || !peer->Current) {
            return std::string("replica ") + (peer->Name ? peer->Name : "?") +
                   (peer->Offline ? " (offline)" : " to catch up");
        }
    }
    return {};
}

}  // namespace

std::string QVReportingExportPublisher::ensureStream(std::string* unsettled) {
    jsStreamInfo* info = nullptr;
    jsErrCode code = static_cast<jsErrCode>(0);
    const auto found = [&] {
        if (unsettled) {
            *unsettled = unsettledPart(*info);
        }
        jsStreamInfo_Destroy(info);
        return std::string();
    };
    natsStatus s = js_GetStreamInfo(&info, nats_->js, settings_.stream.c_str(), nullptr, &code);
    if (s == NATS_OK) {
        return found();
    }
    if (s != NATS_NOT_FOUND && code != JSStreamNotFoundErr) {
        return "stream " + settings_.stream + ": " + QVReportingExportNatsError(s);
    }
    const char* subjects[] = {kSubjects};
    jsStreamConfig config;
    jsStreamConfig_Init(&config);
    config.Name = settings_.stream.c_str();
    config.Subjects = subjects;
    config.SubjectsLen = 1;
    config.Storage = js_FileStorage;
    config.Replicas = settings_.replicas;
    config.Duplicates =
        std::chrono::duration_cast<std::chrono::nanoseconds>(settings_.duplicateWindow).count();
    s = js_AddStream(&info, nats_->js, &config, nullptr, &code);
    if (s != NATS_OK) {
        return "cannot create stream " + settings_.stream + ": " + QVReportingExportNatsError(s);
    }
    return found();
}

std::string QVReportingExportPublisher::publish(std::string_view sink, std::uint64_t seq,
                                                std::string_view text) {
    auto prefix = idPrefixes_.find(sink);
    if (prefix == idPrefixes_.end()) {
        prefix =
            idPrefixes_.emplace(std::string(sink), device_ + "." + std::string(sink) + ".").first;
    }
    // "qvreporting." + the ID's prefix without its last dot is the subject.
    char subject[256];
    char id[256];
    const auto& idPrefix = prefix->second;
    if (idPrefix.size() + 32 > sizeof(id)) {
        return "sink name too long: " + std::string(sink);
    }
    std::snprintf(subject, sizeof(subject), "qvreporting.%.*s",
                  static_cast<int>(idPrefix.size() - 1), idPrefix.data());
    std::snprintf(id, sizeof(id), "%s%llu", idPrefix.c_str(), static_cast<unsigned long long>(seq));
    natsMsg* msg = nullptr;
    natsStatus s =
        natsMsg_Create(&msg, subject, nullptr, text.data(), static_cast<int>(text.size()));
    if (s == NATS_OK) {
        jsPubOptions options;
        jsPubOptions_Init(&options);
        options.MsgId = id;
        s = js_PublishMsgAsync(nats_->js, &msg, &options);
    }
    natsMsg_Destroy(msg);  // nothing when the library took it
    return s == NATS_OK ? std::string() : QVReportingExportNatsError(s);
}

std::size_t QVReportingExportPublisher::abandonPending() {
    natsMsgList pending{};
    if (js_PublishAsyncGetPendingList(&pending, nats_->js) != NATS_OK) {
        return 0;  // NATS_NOT_FOUND: nothing pending
    }
    const auto count = static_cast<std::size_t>(pending.Count);
    natsMsgList_Destroy(&pending);
    return count;
}

void QVReportingExportPublisher::drain(std::chrono::milliseconds timeout) {
    jsPubOptions options;
    jsPubOptions_Init(&options);
    options.MaxWait = timeout.count();
    js_PublishAsyncComplete(nats_->js, &options);
}

std::string QVReportingExportPublisher::subject(std::string_view device, std::string_view sink) {
    return "qvreporting." + std::string(device) + "." + std::string(sink);
}

std::string QVReportingExportPublisher::messageID(std::string_view device, std::string_view sink,
                                                  std::uint64_t seq) {
    return std::string(device) + "." + std::string(sink) + "." + std::to_string(seq);
}

}  // namespace qv::exporter
