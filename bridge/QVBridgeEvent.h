// What the PipeWire side hands the D-Bus side: one operation on one reporting session, with the
// message payload it carries. Plain values only, so that either side can be tested alone.
#pragma once

#include <cstdint>
#include <string>
#include <utility>
#include <variant>
#include <vector>

namespace qv::bridge {

using QVBridgeValue = std::variant<bool, std::int64_t, double, std::string>;
// Keys in the order they were set, as the daemon keeps them.
using QVBridgePayload = std::vector<std::pair<std::string, QVBridgeValue>>;

// The message categories and types the bridge sends (the daemon's vocabulary).
namespace category {
inline constexpr std::uint32_t kRecord = 2;
inline constexpr std::uint32_t kInput = 3;
inline constexpr std::uint32_t kPlayback = 4;
inline constexpr std::uint32_t kOutput = 5;
inline constexpr std::uint32_t kIO = 7;
inline constexpr std::uint32_t kRouteChange = 10;
inline constexpr std::uint32_t kVolume = 14;
}  // namespace category
namespace type {
inline constexpr std::uint16_t kStart = 1;
inline constexpr std::uint16_t kStop = 2;
inline constexpr std::uint16_t kError = 6;
inline constexpr std::uint16_t kState = 18;
}  // namespace type

struct QVBridgeEvent {
    enum class Kind {
        kOpen,     // create the session, set its service type, configure it
        kStart,    // start it (before its first message)
        kMessage,  // send one message to it
        kClose,    // stop and destroy it
    };
    Kind kind = Kind::kMessage;
    std::int64_t reporterID = 0;

    // kOpen: what the session is made of; also kept by the sender to make it again.
    std::uint16_t serviceType = 0;
    std::string applicationID;
    std::string nodeName;  // for the log only
    bool output = true;    // playback (true) or recording

    // kMessage
    std::uint32_t category = 0;
    std::uint16_t type = 0;
    QVBridgePayload payload;
};

// Looks a key up in a payload; null when absent.
const QVBridgeValue* QVBridgePayloadFind(const QVBridgePayload& payload, const std::string& key);
// Sets a key, replacing its value in place when present.
void QVBridgePayloadSet(QVBridgePayload& payload, const std::string& key, QVBridgeValue value);
// One line of JSON, for --dry-run and the log.
std::string QVBridgeEventJson(const QVBridgeEvent& event);

}  // namespace qv::bridge
