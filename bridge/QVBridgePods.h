// Reading the PipeWire parameters the bridge watches into plain values: a node's Props (channel
// volumes, mute), its negotiated Format, and the profiler's per-cycle measurements. Each reader
// takes what it finds and leaves the rest unset; malformed parts are skipped.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

struct spa_pod;

namespace qv::bridge {

struct QVBridgePropsParam {
    std::optional<std::vector<float>> channelVolumes;
    std::optional<bool> mute;
};
QVBridgePropsParam QVBridgeParseProps(const spa_pod* pod);

struct QVBridgeFormatParam {
    std::string sampleFormat;  // "F32LE", "S16LE", ...
    std::uint32_t rate = 0;
    std::uint32_t channels = 0;
};
// Raw audio formats only; nullopt for anything else.
std::optional<QVBridgeFormatParam> QVBridgeParseFormat(const spa_pod* pod);

// One graph cycle of one driver as the profiler reports it.
struct QVBridgeProfilerCycle {
    std::uint32_t driverID = 0;
    std::string driverName;
    std::int32_t xrunCount = 0;  // the driver's xruns so far
    std::uint32_t quantum = 0;   // the cycle's duration in frames
    struct Follower {
        std::uint32_t id = 0;
        std::int32_t status = 0;  // 3: finished in time
    };
    std::vector<Follower> followers;
};
// The profile event's struct of Profiler objects, one cycle each.
std::vector<QVBridgeProfilerCycle> QVBridgeParseProfile(const spa_pod* pod);

// The status a node reports when it finished its cycle in time.
inline constexpr std::int32_t kQVBridgeNodeFinished = 3;

}  // namespace qv::bridge
