// What the bridge knows of one audio stream node at one moment, as the reporter compares it.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace qv::bridge {

struct QVBridgeStreamState {
    std::uint32_t nodeID = 0;
    bool output = true;                 // Stream/Output/Audio (playback) or Stream/Input/Audio
    std::string role;                   // media.role, may be empty
    std::string applicationID;          // QVBridgeApplicationID
    std::string nodeName;               // node.name, for the log
    bool running = false;               // the node's state is "running"
    std::optional<double> volume;       // QVBridgeSessionVolume, once the node's Props are known
    std::string device = "unknown";     // QVBridgeDeviceKind of what it is linked to
    std::optional<std::string> format;  // QVBridgeFormatText, once negotiated
    std::string sampleFormat;           // "F32LE"
    std::uint32_t channels = 0;

    bool operator==(const QVBridgeStreamState&) const = default;
};

}  // namespace qv::bridge
