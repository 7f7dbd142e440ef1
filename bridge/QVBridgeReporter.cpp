#include "QVBridgeReporter.h"

#include "QVBridgeMapping.h"

namespace qv::bridge {

QVBridgeReporter::QVBridgeReporter(std::int64_t firstReporterID)
    : nextReporterID_(firstReporterID) {}

QVBridgePayload QVBridgeReporter::statePayload(const QVBridgeStreamState& state) {
    QVBridgePayload p;
    if (state.volume) {
        p.emplace_back("KXSessionVolume", *state.volume);
    }
    p.emplace_back("active_devices", state.device);
    if (state.format) {
        p.emplace_back("session_selected_format", *state.format);
        p.emplace_back("mFormatID", state.sampleFormat);
        p.emplace_back("mChannelsPerFrame", static_cast<std::int64_t>(state.channels));
    }
    return p;
}

QVBridgeEvent QVBridgeReporter::message(const Reported& r, std::uint32_t category,
                                        std::uint16_t type, QVBridgePayload payload) {
    QVBridgeEvent e;
    e.kind = QVBridgeEvent::Kind::kMessage;
    e.reporterID = r.reporterID;
    e.output = r.last.output;
    e.category = category;
    e.type = type;
    e.payload = std::move(payload);
    return e;
}

QVBridgeEvent QVBridgeReporter::runningMessage(const Reported& r, const QVBridgeStreamState& state,
                                               bool running) {
    QVBridgePayload p;
    p.emplace_back(state.output ? "session_output_running" : "session_input_running", running);
    for (auto& entry : statePayload(state)) {
        p.push_back(std::move(entry));
    }
    return message(r, state.output ? category::kPlayback : category::kRecord,
                   running ? type::kStart : type::kStop, std::move(p));
}

std::vector<QVBridgeEvent> QVBridgeReporter::update(const QVBridgeStreamState& now) {
    std::vector<QVBridgeEvent> events;
    auto it = streams_.find(now.nodeID);
    if (it == streams_.end()) {
        Reported r;
        r.reporterID = nextReporterID_++;
        r.last = now;
        QVBridgeEvent open;
        open.kind = QVBridgeEvent::Kind::kOpen;
        open.reporterID = r.reporterID;
        open.serviceType = QVBridgeServiceTypeForRole(now.role);
        open.applicationID = now.applicationID;
        open.nodeName = now.nodeName;
        open.output = now.output;
        events.push_back(std::move(open));
        // Seen for the first time: nothing ran before, whatever the last state says.
        r.last.running = false;
        it = streams_.emplace(now.nodeID, std::move(r)).first;
    }
    Reported& r = it->second;
    const QVBridgeStreamState before = r.last;
    r.last = now;

    if (!r.started) {
        if (!now.running) {
            return events;
        }
        QVBridgeEvent start;
        start.kind = QVBridgeEvent::Kind::kStart;
        start.reporterID = r.reporterID;
        events.push_back(std::move(start));
        r.started = true;
        events.push_back(runningMessage(r, now, true));
        return events;
    }
    if (before.running != now.running) {
        events.push_back(runningMessage(r, now, now.running));
        return events;
    }
    if (before.volume != now.volume && now.volume) {
        events.push_back(message(r, category::kVolume, type::kState, statePayload(now)));
    }
    if (before.device != now.device) {
        events.push_back(message(r, category::kRouteChange, type::kState, statePayload(now)));
    }
    if ((before.format != now.format || before.channels != now.channels) && now.format) {
        events.push_back(message(r, now.output ? category::kOutput : category::kInput, type::kState,
                                 statePayload(now)));
    }
    return events;
}

std::vector<QVBridgeEvent> QVBridgeReporter::xruns(std::uint32_t nodeID, std::uint64_t count,
                                                   std::uint32_t quantum,
                                                   const std::string& driver) {
    auto it = streams_.find(nodeID);
    if (it == streams_.end() || count == 0) {
        return {};
    }
    Reported& r = it->second;
    r.xruns += count;
    if (!r.started) {
        return {};
    }
    QVBridgePayload p;
    p.emplace_back("issue_type", std::string("overload"));
    p.emplace_back("smallest_buffer_frame_size", static_cast<std::int64_t>(quantum));
    p.emplace_back("io_cycle", static_cast<std::int64_t>(r.xruns));
    p.emplace_back("xrun_count", static_cast<std::int64_t>(count));
    p.emplace_back("driver", driver);
    for (auto& entry : statePayload(r.last)) {
        p.push_back(std::move(entry));
    }
    return {message(r, category::kIO, type::kError, std::move(p))};
}

std::vector<QVBridgeEvent> QVBridgeReporter::remove(std::uint32_t nodeID) {
    auto it = streams_.find(nodeID);
    if (it == streams_.end()) {
        return {};
    }
    std::vector<QVBridgeEvent> events;
    const Reported& r = it->second;
    if (r.started && r.last.running) {
        events.push_back(runningMessage(r, r.last, false));
    }
    QVBridgeEvent close;
    close.kind = QVBridgeEvent::Kind::kClose;
    close.reporterID = r.reporterID;
    events.push_back(std::move(close));
    streams_.erase(it);
    return events;
}

std::vector<QVBridgeEvent> QVBridgeReporter::removeAll() {
    std::vector<QVBridgeEvent> events;
    while (!streams_.empty()) {
        for (auto& e : remove(streams_.begin()->first)) {
            events.push_back(std::move(e));
        }
    }
    return events;
}

}  // namespace qv::bridge
