#include "QVBridgeSender.h"

#include <QVReportingClient.h>

#include "QVBridgeLog.h"

namespace qv::bridge {

namespace {

using Clock = std::chrono::steady_clock;
constexpr std::chrono::milliseconds kPopWait{200};
constexpr std::chrono::seconds kReconnectDelay{1};

client::VariantMap toVariants(const QVBridgePayload& payload) {
    client::VariantMap map;
    for (const auto& [key, value] : payload) {
        std::visit([&](const auto& v) { map.emplace(key, sdbus::Variant(v)); }, value);
    }
    return map;
}

bool isStreamState(std::uint32_t category) {
    return category != category::kIO;
}

}  // namespace

QVBridgeSender::QVBridgeSender(QVBridgeEventQueue& queue, QVBridgeStats& stats, Options options)
    : queue_(queue), stats_(stats), options_(std::move(options)) {}

QVBridgeSender::~QVBridgeSender() {
    queue_.close();
    join();
}

void QVBridgeSender::start() {
    thread_ = std::thread([this] { run(); });
}

void QVBridgeSender::join() {
    if (thread_.joinable()) {
        thread_.join();
    }
}

void QVBridgeSender::run() {
    checkDaemon(true);
    QVBridgeEvent event;
    for (;;) {
        const bool got = queue_.pop(event, kPopWait);
        checkDaemon(false);
        if (got) {
            handle(event);
        } else if (queue_.closed()) {
            break;
        }
    }
    if (!sessions_.empty()) {
        QVBridgeLog(QVBridgeLogLevel::kError, "{} sessions left open at exit", sessions_.size());
    }
    client_.reset();
}

void QVBridgeSender::checkDaemon(bool force) {
    if (options_.dryRun) {
        return;
    }
    const auto now = Clock::now();
    if (!force && now < nextCheck_) {
        return;
    }
    nextCheck_ = now + options_.ownerCheckInterval;
    std::string owner;
    try {
        if (!client_) {
            client_ = client::QVReportingClient::connect(options_.bus);
        }
        owner = client_->daemonOwner();
    } catch (const std::exception& e) {
        if (!absenceLogged_) {
            QVBridgeLog(QVBridgeLogLevel::kError, "cannot reach the bus '{}': {}", options_.bus,
                        e.what());
            absenceLogged_ = true;
        }
        client_.reset();
        owner_.clear();
        nextCheck_ = now + kReconnectDelay;
        return;
    }
    if (owner.empty()) {
        if (!owner_.empty() || !absenceLogged_) {
            QVBridgeLog(QVBridgeLogLevel::kInfo,
                        "the reporting daemon is not on the bus; {} sessions wait for it",
                        sessions_.size());
            absenceLogged_ = true;
        }
        owner_.clear();
        for (auto& [id, s] : sessions_) {
            s.made = false;
        }
        return;
    }
    if (owner == owner_) {
        // Sessions whose making failed halfway get another try.
        for (auto& [id, s] : sessions_) {
            if (!s.made) {
                makeSession(id, s);
            }
        }
        return;
    }
    const bool restart = everMet_;
    owner_ = owner;
    everMet_ = true;
    absenceLogged_ = false;
    failing_ = false;
    for (auto& [id, s] : sessions_) {
        s.made = false;
        makeSession(id, s);
    }
    if (restart) {
        stats_.noteDaemonReconnect();
        QVBridgeLog(QVBridgeLogLevel::kInfo,
                    "the reporting daemon restarted ({}): re-created {} sessions", owner,
                    sessions_.size());
    } else {
        QVBridgeLog(QVBridgeLogLevel::kInfo, "reporting to the daemon at {} on the bus '{}'", owner,
                    options_.bus);
    }
}

void QVBridgeSender::callFailed(const char* what, std::int64_t reporterID,
                                const std::exception& error) {
    if (!failing_) {
        QVBridgeLog(QVBridgeLogLevel::kError, "{} for reporter {} failed: {}", what, reporterID,
                    error.what());
        failing_ = true;
    }
    nextCheck_ = {};
}

void QVBridgeSender::makeSession(std::int64_t reporterID, Session& s) {
    try {
        client_->createReportingSession(reporterID);
        client_->setServiceType(s.open.serviceType, reporterID);
        client_->setConfiguration(
            {{"KXHostApplicationDisplayID", sdbus::Variant(s.open.applicationID)}}, reporterID);
        s.made = true;
        if (s.started) {
            // The reply is held until the session stops; nothing waits for it.
            client_->startReportingSessionAsync(reporterID,
                                                [](const client::QVReportingClientError*, bool) {});
        }
        if (s.running) {
            QVBridgePayload p;
            p.emplace_back(s.open.output ? "session_output_running" : "session_input_running",
                           true);
            for (const auto& entry : s.state) {
                if (entry.first != p.front().first) {
                    p.push_back(entry);
                }
            }
            sendMessage(s, reporterID, s.open.output ? category::kPlayback : category::kRecord,
                        type::kStart, p);
        }
        failing_ = false;
    } catch (const std::exception& e) {
        callFailed("making the session", reporterID, e);
    }
}

void QVBridgeSender::sendMessage(const Session& s, std::int64_t reporterID, std::uint32_t category,
                                 std::uint16_t type, const QVBridgePayload& payload) {
    if (!present() || !s.made) {
        stats_.noteMessageUndelivered();
        return;
    }
    try {
        client_->sendMessage(toVariants(payload), category, type, {reporterID});
        stats_.noteMessageSent();
        failing_ = false;
    } catch (const std::exception& e) {
        stats_.noteMessageUndelivered();
        callFailed("sending a message", reporterID, e);
    }
}

void QVBridgeSender::handle(QVBridgeEvent& event) {
    if (options_.dryRun) {
        const std::string line = QVBridgeEventJson(event);
        std::fprintf(options_.dryRunOutput, "%s\n", line.c_str());
        std::fflush(options_.dryRunOutput);
        if (event.kind == QVBridgeEvent::Kind::kMessage) {
            stats_.noteMessageSent();
        }
        return;
    }
    const std::int64_t id = event.reporterID;
    switch (event.kind) {
        case QVBridgeEvent::Kind::kOpen: {
            QVBridgeLog(QVBridgeLogLevel::kInfo, "stream '{}' of {}: session {}", event.nodeName,
                        event.applicationID, id);
            Session& s = sessions_[id];
            s.open = std::move(event);
            if (present()) {
                makeSession(id, s);
            }
            return;
        }
        case QVBridgeEvent::Kind::kStart: {
            auto it = sessions_.find(id);
            if (it == sessions_.end()) {
                return;
            }
            it->second.started = true;
            if (present() && it->second.made) {
                client_->startReportingSessionAsync(
                    id, [](const client::QVReportingClientError*, bool) {});
            }
            return;
        }
        case QVBridgeEvent::Kind::kMessage: {
            auto it = sessions_.find(id);
            if (it == sessions_.end()) {
                return;
            }
            Session& s = it->second;
            if (isStreamState(event.category)) {
                for (const auto& [key, value] : event.payload) {
                    QVBridgePayloadSet(s.state, key, value);
                }
                const char* runningKey =
                    s.open.output ? "session_output_running" : "session_input_running";
                if (const auto* running = QVBridgePayloadFind(event.payload, runningKey)) {
                    s.running = std::get<bool>(*running);
                }
            }
            sendMessage(s, id, event.category, event.type, event.payload);
            return;
        }
        case QVBridgeEvent::Kind::kClose: {
            auto it = sessions_.find(id);
            if (it == sessions_.end()) {
                return;
            }
            if (present() && it->second.made) {
                try {
                    // Stopping makes the daemon derive the session's messages.
                    client_->stopReportingSession(id);
                    client_->destroyReportingSession(id);
                } catch (const std::exception& e) {
                    callFailed("closing the session", id, e);
                }
            }
            sessions_.erase(it);
            return;
        }
    }
}

}  // namespace qv::bridge
