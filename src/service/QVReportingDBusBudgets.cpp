// QVReportingDBusServer's budgets and answers: a call admitted against its client's budgets,
// kept with its charge until it is answered or let go, and answered on the loop thread.
#include <time.h>

#include <cstring>

#include <fmt/format.h>

#include "service/QVReportingDBusServer.h"
#include "session/QVReportingLog.h"

namespace qv {

std::uint64_t QVReportingDBusServer::monotonicMicros() {
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<std::uint64_t>(ts.tv_sec) * 1000000u +
           static_cast<std::uint64_t>(ts.tv_nsec) / 1000u;
}

QVReportingDBusServer::Client* QVReportingDBusServer::admit(Connection& c, sd_bus_message* call,
                                                            bool held) {
    std::string key;
    if (c.direct) {
        key = c.key;
    } else if (const char* sender = sd_bus_message_get_sender(call)) {
        key = sender;
    }
    auto it = clients_.find(key);
    if (it == clients_.end()) {
        std::int64_t pid = c.pid;
        if (!c.direct) {
            // Asking the bus for the peer's PID is a round trip: done once per connection.
            sd_bus_creds* creds = nullptr;
            pid_t busPid = 0;
            const int r = sd_bus_query_sender_creds(call, SD_BUS_CREDS_PID, &creds);
            if (r < 0 || sd_bus_creds_get_pid(creds, &busPid) < 0) {
                QVLOG_ERROR(QVReportingServiceDelegateCategory(), "no process ID for {}: {}", key,
                            strerror(-r));
            }
            sd_bus_creds_unref(creds);
            pid = busPid;
        }
        auto instance = service_.acceptConnection(pid);
        if (!instance) {
            refuse(call, QVReportingError::limitsExceeded("too many clients"));
            return nullptr;
        }
        Client client;
        client.instance = std::move(instance);
        client.key = key;
        client.direct = c.direct;
        client.payloadAllowance = static_cast<double>(limits_.maxCallBytesPerClient);
        client.allowanceMicros = monotonicMicros();
        it = clients_.emplace(key, std::move(client)).first;
        busClientCount_ += c.direct ? 0 : 1;
    }
    Client& client = it->second;
    const std::uint64_t now = monotonicMicros();
    client.payloadAllowance = std::min(
        static_cast<double>(limits_.maxCallBytesPerClient),
        client.payloadAllowance + static_cast<double>(limits_.maxPayloadBytesPerSecondPerClient) *
                                      static_cast<double>(now - client.allowanceMicros) / 1e6);
    client.allowanceMicros = now;
    // Checked before the arguments are read, so a refusal costs next to nothing.
    std::optional<QVReportingStats::Limit> over;
    std::string why;
    if (held && client.heldCalls >= limits_.maxHeldCallsPerClient) {
        over = QVReportingStats::Limit::HeldCallsPerClient;
        why = fmt::format("a client may have at most {} start calls waiting for their sessions",
                          limits_.maxHeldCallsPerClient);
    } else if (held && heldCalls_ >= limits_.maxHeldCalls) {
        over = QVReportingStats::Limit::HeldCalls;
        why =
            fmt::format("at most {} start calls may wait for their sessions", limits_.maxHeldCalls);
    } else if (client.callBytes >= limits_.maxCallBytesPerClient) {
        over = QVReportingStats::Limit::CallBytesPerClient;
        why = fmt::format("a client's calls not yet answered may take at most {} bytes",
                          limits_.maxCallBytesPerClient);
    } else if (client.payloadAllowance <= 0) {
        over = QVReportingStats::Limit::PayloadRatePerClient;
        why = fmt::format("a client may send at most {} payload bytes a second",
                          limits_.maxPayloadBytesPerSecondPerClient);
    }
    if (over) {
        QVReportingStats::shared().noteLimitExceeded(*over);
        refuse(call, QVReportingError::limitsExceeded(std::move(why)));
        return nullptr;
    }
    return &client;
}

QVReportingDBusServer::Ticket::~Ticket() {
    if (answered) {
        return;
    }
    // No answer will come (the rules give this call none): let it go.
    std::lock_guard lock(lifeline->mutex);
    if (auto* server = lifeline->server) {
        server->post([server, id = id] { server->release(id); });
    }
}

QVReportingDBusServer::TicketPtr QVReportingDBusServer::hold(sd_bus_message* call, Client& client,
                                                             std::size_t argumentBytes, bool held) {
    const CallID id = nextCallID_++;
    // A held call waits on its session, not on the queue: it is kept within the count of held
    // calls instead of the bytes of calls in flight.
    const std::size_t bytes = held ? 0 : QVReportingStats::kCallOverheadBytes + argumentBytes;
    client.callBytes += bytes;
    client.heldCalls += held ? 1 : 0;
    callBytes_ += bytes;
    heldCalls_ += held ? 1 : 0;
    pending_.emplace(id, Pending{MessagePtr(sd_bus_message_ref(call)), client.key, bytes, held});
    noteBudgets();
    return std::make_shared<Ticket>(lifeline_, id);
}

QVReportingDBusServer::MessagePtr QVReportingDBusServer::release(CallID id) {
    auto it = pending_.find(id);
    if (it == pending_.end()) {
        return nullptr;  // the caller left
    }
    Pending pending = std::move(it->second);
    pending_.erase(it);
    callBytes_ -= pending.bytes;
    heldCalls_ -= pending.held ? 1 : 0;
    if (auto c = clients_.find(pending.client); c != clients_.end()) {
        c->second.callBytes -= pending.bytes;
        c->second.heldCalls -= pending.held ? 1 : 0;
    }
    noteBudgets();
    return std::move(pending.call);
}

void QVReportingDBusServer::noteBudgets() const {
    QVReportingStats::shared().noteCallBudget(callBytes_, heldCalls_);
}

void QVReportingDBusServer::answer(const TicketPtr& ticket,
                                   const std::optional<QVReportingError>& error, Fill fill) {
    ticket->answered = true;
    post([this, id = ticket->id, error, fill = std::move(fill)] {
        MessagePtr call = release(id);
        if (!call || !sd_bus_message_get_expect_reply(call.get())) {
            return;
        }
        if (error) {
            refuse(call.get(), *error);
            return;
        }
        sd_bus_message* reply = nullptr;
        if (sd_bus_message_new_method_return(call.get(), &reply) < 0) {
            return;
        }
        MessagePtr owned(reply);
        if (fill) {
            if (const int r = fill(reply); r < 0) {
                QVLOG_ERROR(QVReportingServiceDelegateCategory(), "cannot write a reply: {}",
                            strerror(-r));
                return;
            }
        }
        // A client gone meanwhile makes this fail; nothing is owed to it.
        sd_bus_send(nullptr, reply, nullptr);
    });
}

void QVReportingDBusServer::refuse(sd_bus_message* call, const QVReportingError& error) {
    if (sd_bus_message_get_expect_reply(call)) {
        sd_bus_reply_method_errorf(call, error.name.c_str(), "%s", error.message.c_str());
    }
}

}  // namespace qv
