// The payload the intake benchmarks send: ten keys of the usual kinds, as a client reports a
// playback state, one of them nested. seq varies the volume and the sequence number.
#pragma once

#include <cstdint>

#include "values/Value.h"

namespace qv::bench {

inline Dictionary playbackPayload(std::int64_t seq, double timestamp) {
    return Dictionary{
        {"qvreporting_timestamp", timestamp},
        {"session_selected_format", "lpcm-48000-2ch-f32"},
        {"active_devices", "Speaker"},
        {"KXSessionVolume", 0.5 + static_cast<double>(seq % 7) / 100.0},
        {"session_output_running", true},
        {"mChannelsPerFrame", 2},
        {"sequence", seq},
        {"route", "BuiltInSpeaker"},
        {"latency_ms", 11.6},
        {"format", Dictionary{{"rate", 48000}, {"bits", 32}}},
    };
}

}  // namespace qv::bench
