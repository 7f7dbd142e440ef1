#include "QVBridgeEvent.h"

#include <nlohmann/json.hpp>

namespace qv::bridge {

const QVBridgeValue* QVBridgePayloadFind(const QVBridgePayload& payload, const std::string& key) {
    for (const auto& [k, v] : payload) {
        if (k == key) {
            return &v;
        }
    }
    return nullptr;
}

void QVBridgePayloadSet(QVBridgePayload& payload, const std::string& key, QVBridgeValue value) {
    for (auto& [k, v] : payload) {
        if (k == key) {
            v = std::move(value);
            return;
        }
    }
    payload.emplace_back(key, std::move(value));
}

std::string QVBridgeEventJson(const QVBridgeEvent& event) {
    // ordered_json keeps the payload's keys in the order the daemon will see them.
    nlohmann::ordered_json j;
    switch (event.kind) {
        case QVBridgeEvent::Kind::kOpen:
            j["op"] = "open";
            break;
        case QVBridgeEvent::Kind::kStart:
            j["op"] = "start";
            break;
        case QVBridgeEvent::Kind::kMessage:
            j["op"] = "send";
            break;
        case QVBridgeEvent::Kind::kClose:
            j["op"] = "close";
            break;
    }
    j["reporterID"] = event.reporterID;
    if (event.kind == QVBridgeEvent::Kind::kOpen) {
        j["serviceType"] = event.serviceType;
        j["KXHostApplicationDisplayID"] = event.applicationID;
        j["node"] = event.nodeName;
    }
    if (event.kind == QVBridgeEvent::Kind::kMessage) {
        j["category"] = event.category;
        j["type"] = event.type;
        nlohmann::ordered_json payload = nlohmann::ordered_json::object();
        for (const auto& [key, value] : event.payload) {
            std::visit([&](const auto& v) { payload[key] = v; }, value);
        }
        j["payload"] = std::move(payload);
    }
    return j.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
}

}  // namespace qv::bridge
