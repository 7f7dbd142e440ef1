// QVReportingDBusServer's method handlers and the vtables that name them: each reads its
// arguments straight from the call, admits the call against its client's budgets, and hands the
// work to the client's object; answers come back through answer().
#include <fmt/format.h>

#include "QVReportingDBusNames.h"
#include "platform/linux/system/LinuxNotificationCenter.h"
#include "service/QVReportingDBusServer.h"
#include "session/QVReportingLog.h"

namespace qv {

namespace {

constexpr const char* kErrorFailed = "org.freedesktop.DBus.Error.Failed";
constexpr const char* kErrorAccessDenied = "org.freedesktop.DBus.Error.AccessDenied";
constexpr const char* kErrorNameHasNoOwner = "org.freedesktop.DBus.Error.NameHasNoOwner";

}  // namespace

template <void (QVReportingDBusServer::*Method)(QVReportingDBusServer::Connection&,
                                                sd_bus_message*)>
int QVReportingDBusServer::dispatch(sd_bus_message* call, void* userdata, sd_bus_error*) {
    auto& connection = *static_cast<Connection*>(userdata);
    try {
        (connection.server->*Method)(connection, call);
    } catch (const std::exception& e) {
        // Nothing may unwind through sd-bus: the call fails alone.
        QVLOG_ERROR(QVReportingServiceDelegateCategory(), "a call failed: {}", e.what());
        refuse(call, {kErrorFailed, e.what()});
    }
    return 1;
}

QVReportingClientServerInstance::BoolReply QVReportingDBusServer::boolReply(TicketPtr ticket) {
    return [this, ticket](const std::optional<QVReportingError>& error, bool result) {
        answer(ticket, error, [result](sd_bus_message* reply) {
            const int b = result ? 1 : 0;
            return sd_bus_message_append_basic(reply, 'b', &b);
        });
    };
}

bool QVReportingDBusServer::readPayload(sd_bus_message* call, Client& client,
                                        QVReportingDecodeResult& decoded) {
    decoded = QVReportingReadDictionary(call, budget_);
    client.payloadAllowance -= static_cast<double>(decoded.bytes);
    if (!decoded.error) {
        return true;
    }
    decoded.limit ? QVReportingStats::shared().noteLimitExceeded(*decoded.limit)
                  : QVReportingStats::shared().noteInputRefused();
    refuse(call, *decoded.error);
    return false;
}

// What a decoded payload costs while its call waits: as received, and as decoded.
static std::size_t payloadBytes(const QVReportingDecodeResult& decoded) {
    return decoded.bytes + decoded.dictionary.approximateHeapBytes();
}

static QVReportingError unreadableArguments() {
    return QVReportingError::invalidArgs("the call's arguments cannot be read");
}

QVReportingDBusServer::Client* QVReportingDBusServer::admitWithID(Connection& connection,
                                                                  sd_bus_message* call,
                                                                  ReporterID& id, bool held) {
    Client* client = admit(connection, call, held);
    if (client && sd_bus_message_read_basic(call, 'x', &id) < 0) {
        refuse(call, unreadableArguments());
        return nullptr;
    }
    return client;
}

template <QVReportingDBusServer::IDCall Op, bool Held>
void QVReportingDBusServer::idCall(Connection& connection, sd_bus_message* call) {
    ReporterID id = 0;
    Client* client = admitWithID(connection, call, id, Held);
    if (!client) {
        return;
    }
    auto instance = client->instance;
    ((*instance).*Op)(id, boolReply(hold(call, *client, 0, Held)));
}

void QVReportingDBusServer::setServiceType(Connection& connection, sd_bus_message* call) {
    Client* client = admit(connection, call);
    if (!client) {
        return;
    }
    std::uint16_t type = 0;
    ReporterID id = 0;
    if (sd_bus_message_read(call, "qx", &type, &id) < 0) {
        return refuse(call, unreadableArguments());
    }
    auto instance = client->instance;
    instance->setServiceType(type, id, boolReply(hold(call, *client, 0)));
}

void QVReportingDBusServer::getServiceNameForReporterID(Connection& connection,
                                                        sd_bus_message* call) {
    ReporterID id = 0;
    Client* client = admitWithID(connection, call, id);
    if (!client) {
        return;
    }
    auto instance = client->instance;
    auto ticket = hold(call, *client, 0);
    instance->getServiceNameForReporterID(
        id, [this, ticket](const std::optional<QVReportingError>& e, AudioServiceType t) {
            answer(ticket, e, [t](sd_bus_message* reply) {
                const std::uint16_t type = t;
                return sd_bus_message_append_basic(reply, 'q', &type);
            });
        });
}

void QVReportingDBusServer::setConfiguration(Connection& connection, sd_bus_message* call) {
    Client* client = admit(connection, call);
    QVReportingDecodeResult decoded;
    if (!client || !readPayload(call, *client, decoded)) {
        return;
    }
    ReporterID id = 0;
    if (!QVReportingReadRest(call, decoded, id)) {
        return refuse(call, unreadableArguments());
    }
    auto instance = client->instance;
    const std::size_t bytes = payloadBytes(decoded);
    instance->setConfiguration(std::move(decoded.dictionary), id,
                               boolReply(hold(call, *client, bytes)));
}

void QVReportingDBusServer::sendMessage(Connection& connection, sd_bus_message* call) {
    Client* client = admit(connection, call);
    QVReportingDecodeResult decoded;
    if (!client || !readPayload(call, *client, decoded)) {
        return;
    }
    std::uint32_t category = 0;
    std::uint16_t type = 0;
    std::vector<std::int64_t> ids;
    if (!QVReportingReadRest(call, decoded, category, type, ids)) {
        return refuse(call, unreadableArguments());
    }
    if (ids.size() > limits_.maxReporterIDsPerMessage) {
        QVReportingStats::shared().noteLimitExceeded(QVReportingStats::Limit::ReporterIDs);
        return refuse(call, QVReportingError::limitsExceeded(
                                fmt::format("a message may name at most {} reporter IDs",
                                            limits_.maxReporterIDsPerMessage)));
    }
    auto instance = client->instance;
    const std::size_t bytes = payloadBytes(decoded) + ids.size() * sizeof(ReporterID);
    auto ticket = hold(call, *client, bytes);
    instance->sendMessage(
        std::move(decoded.dictionary), category, type, std::move(ids),
        [this, ticket](const std::optional<QVReportingError>& e) { answer(ticket, e, nullptr); });
}

void QVReportingDBusServer::reporterIDValid(Connection& connection, sd_bus_message* call) {
    ReporterID id = 0;
    Client* client = admitWithID(connection, call, id);
    if (!client) {
        return;
    }
    auto instance = client->instance;
    auto ticket = hold(call, *client, 0);
    instance->reporterIDValid(id, [this, ticket](const std::optional<QVReportingError>& e,
                                                 const Dictionary& d) {
        // The reply's two members have fixed types: x and q.
        const ReporterID rid = d.find(dbus::kReporterProxyKeyReporterID)->asInt64().value_or(0);
        const auto type = static_cast<std::uint16_t>(
            d.find(dbus::kReporterProxyKeyServiceType)->asInt64().value_or(0xFFFF));
        answer(ticket, e, [rid, type](sd_bus_message* reply) {
            return sd_bus_message_append(reply, "a{sv}", 2, dbus::kReporterProxyKeyReporterID, "x",
                                         rid, dbus::kReporterProxyKeyServiceType, "q", type);
        });
    });
}

void QVReportingDBusServer::getAllReporters(Connection& connection, sd_bus_message* call) {
    Client* client = admit(connection, call);
    if (!client) {
        return;
    }
    auto instance = client->instance;
    auto ticket = hold(call, *client, 0);
    instance->getAllReporters([this, ticket](const std::optional<QVReportingError>& e,
                                             const std::vector<ReporterID>& ids) {
        answer(ticket, e, [ids](sd_bus_message* reply) {
            return sd_bus_message_append_array(reply, 'x', ids.data(),
                                               ids.size() * sizeof(ReporterID));
        });
    });
}

void QVReportingDBusServer::killService(Connection& connection, sd_bus_message* call) {
    // On the bus its policy lets only root through; a direct connection is checked here alike.
    if (connection.direct && connection.uid != 0) {
        QVLOG_ERROR(QVReportingServiceDelegateCategory(),
                    "refusing KillService from pid {} uid {}: only root may", connection.pid,
                    connection.uid);
        return refuse(call, {kErrorAccessDenied, "only root may end the reporting daemon"});
    }
    if (Client* client = admit(connection, call)) {
        client->instance->killService();
    }
}

void QVReportingDBusServer::getStats(Connection&, sd_bus_message* call) {
    Dictionary stats = QVReportingStats::shared().dump();
    stats.set("bus_clients", std::uint64_t{busClientCount_.load()});
    stats.set("direct_clients", std::uint64_t{clients_.size() - busClientCount_.load()});
    stats.set("direct_connections", std::uint64_t{directCount_.load()});
    stats.set("calls_awaiting_reply", std::uint64_t{pending_.size()});
    stats.set("bus_reads_paused_now", readsPaused_);
    sd_bus_message* reply = nullptr;
    if (sd_bus_message_new_method_return(call, &reply) < 0) {
        return;
    }
    MessagePtr owned(reply);
    if (QVReportingAppendDictionary(reply, stats) >= 0) {
        sd_bus_send(nullptr, reply, nullptr);
    }
}

void QVReportingDBusServer::notifyPost(Connection&, sd_bus_message* call) {
    const char* name = nullptr;
    std::uint64_t state = 0;
    if (sd_bus_message_read(call, "st", &name, &state) < 0) {
        return refuse(call, unreadableArguments());
    }
    notifications_->post(name, state);
    sd_bus_reply_method_return(call, "");
}

void QVReportingDBusServer::notifyGetState(Connection&, sd_bus_message* call) {
    const char* name = nullptr;
    if (sd_bus_message_read(call, "s", &name) < 0) {
        return refuse(call, unreadableArguments());
    }
    sd_bus_reply_method_return(call, "t", notifications_->stateOf(name));
}

void QVReportingDBusServer::hello(Connection& connection, sd_bus_message* call) {
    // A name of the same shape as the bus's own unique names, never one the bus hands out.
    const std::string name = ":direct." + connection.key.substr(connection.key.find(':') + 1);
    sd_bus_reply_method_return(call, "s", name.c_str());
}

void QVReportingDBusServer::getNameOwner(Connection&, sd_bus_message* call) {
    const char* name = nullptr;
    const char* owner = nullptr;
    if (sd_bus_message_read(call, "s", &name) < 0) {
        return refuse(call, unreadableArguments());
    }
    if (std::string_view(name) != dbus::kBusName || sd_bus_get_unique_name(bus_.bus, &owner) < 0) {
        return refuse(call, {kErrorNameHasNoOwner, fmt::format("{} is not served here", name)});
    }
    sd_bus_reply_method_return(call, "s", owner);
}

// ---- the vtables ----

// The handler comes last, as it may be a template with its own commas.
#define QV_METHOD(member, signature, in, result, out, ...)                       \
    SD_BUS_METHOD_WITH_NAMES(                                                    \
        member, signature, in, result, out,                                      \
        (&QVReportingDBusServer::dispatch<&QVReportingDBusServer::__VA_ARGS__>), \
        SD_BUS_VTABLE_UNPRIVILEGED)

using Instance = QVReportingClientServerInstance;

const sd_bus_vtable QVReportingDBusServer::kReportingVtable[] = {
    SD_BUS_VTABLE_START(0),
    QV_METHOD(dbus::kCreateReportingSession, "x", SD_BUS_PARAM(reporterID), "b",
              SD_BUS_PARAM(result), idCall<&Instance::createReportingSession, false>),
    QV_METHOD(dbus::kSetServiceType, "qx", SD_BUS_PARAM(serviceType) SD_BUS_PARAM(reporterID), "b",
              SD_BUS_PARAM(result), setServiceType),
    QV_METHOD(dbus::kGetServiceNameForReporterID, "x", SD_BUS_PARAM(reporterID), "q",
              SD_BUS_PARAM(serviceType), getServiceNameForReporterID),
    QV_METHOD(dbus::kSetConfiguration, "a{sv}x",
              SD_BUS_PARAM(configuration) SD_BUS_PARAM(reporterID), "b", SD_BUS_PARAM(result),
              setConfiguration),
    QV_METHOD(dbus::kStartReportingSession, "x", SD_BUS_PARAM(reporterID), "b",
              SD_BUS_PARAM(result), idCall<&Instance::startReportingSessionForID, true>),
    QV_METHOD(dbus::kSendMessage, "a{sv}uqax",
              SD_BUS_PARAM(payload) SD_BUS_PARAM(category) SD_BUS_PARAM(type)
                  SD_BUS_PARAM(reporterIDs),
              "", , sendMessage),
    QV_METHOD(dbus::kStopReportingSession, "x", SD_BUS_PARAM(reporterID), "b", SD_BUS_PARAM(result),
              idCall<&Instance::stopReportingSessionForID, false>),
    QV_METHOD(dbus::kDestroyReportingSession, "x", SD_BUS_PARAM(reporterID), "b",
              SD_BUS_PARAM(result), idCall<&Instance::destroyReportingSession, false>),
    QV_METHOD(dbus::kReporterIDValid, "x", SD_BUS_PARAM(reporterID), "a{sv}",
              SD_BUS_PARAM(reporter), reporterIDValid),
    QV_METHOD(dbus::kGetAllReporters, "", , "ax", SD_BUS_PARAM(reporterIDs), getAllReporters),
    QV_METHOD(dbus::kKillService, "", , "b", SD_BUS_PARAM(result), killService),
    SD_BUS_VTABLE_END};

const sd_bus_vtable QVReportingDBusServer::kStatsVtable[] = {
    SD_BUS_VTABLE_START(0),
    QV_METHOD(dbus::kGetStats, "", , "a{sv}", SD_BUS_PARAM(stats), getStats), SD_BUS_VTABLE_END};

const sd_bus_vtable QVReportingDBusServer::kNotifyVtable[] = {
    SD_BUS_VTABLE_START(0),
    QV_METHOD(dbus::kPost, "st", SD_BUS_PARAM(name) SD_BUS_PARAM(state), "", , notifyPost),
    QV_METHOD(dbus::kGetState, "s", SD_BUS_PARAM(name), "t", SD_BUS_PARAM(state), notifyGetState),
    SD_BUS_SIGNAL_WITH_NAMES(dbus::kPosted, "st", SD_BUS_PARAM(name) SD_BUS_PARAM(state), 0),
    SD_BUS_VTABLE_END};

// What a client library expects of a bus when it connects to an address: its name, and who owns
// the daemon's name (the daemon's own unique name on the bus).
const sd_bus_vtable QVReportingDBusServer::kPeerBusVtable[] = {
    SD_BUS_VTABLE_START(0), QV_METHOD("Hello", "", , "s", SD_BUS_PARAM(name), hello),
    QV_METHOD("GetNameOwner", "s", SD_BUS_PARAM(name), "s", SD_BUS_PARAM(owner), getNameOwner),
    SD_BUS_VTABLE_END};

#undef QV_METHOD

}  // namespace qv
