#include "QVBridgePods.h"

#include <spa/debug/types.h>
#include <spa/param/audio/format-utils.h>
#include <spa/param/audio/type-info.h>
#include <spa/param/format-utils.h>
#include <spa/param/profiler.h>
#include <spa/param/props.h>
#include <spa/pod/iter.h>
#include <spa/pod/parser.h>

namespace qv::bridge {

QVBridgePropsParam QVBridgeParseProps(const spa_pod* pod) {
    QVBridgePropsParam out;
    if (pod == nullptr || !spa_pod_is_object_type(pod, SPA_TYPE_OBJECT_Props)) {
        return out;
    }
    const auto* object = reinterpret_cast<const spa_pod_object*>(pod);
    const spa_pod_prop* prop;
    SPA_POD_OBJECT_FOREACH(object, prop) {
        switch (prop->key) {
            case SPA_PROP_mute: {
                bool mute = false;
                if (spa_pod_get_bool(&prop->value, &mute) == 0) {
                    out.mute = mute;
                }
                break;
            }
            case SPA_PROP_channelVolumes: {
                float values[SPA_AUDIO_MAX_CHANNELS];
                const std::uint32_t n = spa_pod_copy_array(&prop->value, SPA_TYPE_Float, values,
                                                           SPA_AUDIO_MAX_CHANNELS);
                if (n > 0) {
                    out.channelVolumes = std::vector<float>(values, values + n);
                }
                break;
            }
            default:
                break;
        }
    }
    return out;
}

std::optional<QVBridgeFormatParam> QVBridgeParseFormat(const spa_pod* pod) {
    if (pod == nullptr) {
        return std::nullopt;
    }
    std::uint32_t mediaType = 0;
    std::uint32_t mediaSubtype = 0;
    if (spa_format_parse(pod, &mediaType, &mediaSubtype) < 0 || mediaType != SPA_MEDIA_TYPE_audio ||
        mediaSubtype != SPA_MEDIA_SUBTYPE_raw) {
        return std::nullopt;
    }
    spa_audio_info_raw info{};
    if (spa_format_audio_raw_parse(pod, &info) < 0) {
        return std::nullopt;
    }
    QVBridgeFormatParam out;
    const char* name = spa_debug_type_find_short_name(spa_type_audio_format, info.format);
    out.sampleFormat = name != nullptr ? name : "unknown";
    out.rate = info.rate;
    out.channels = info.channels;
    return out;
}

std::vector<QVBridgeProfilerCycle> QVBridgeParseProfile(const spa_pod* pod) {
    std::vector<QVBridgeProfilerCycle> cycles;
    if (pod == nullptr || !spa_pod_is_struct(pod)) {
        return cycles;
    }
    // SPA_POD_STRUCT_FOREACH does arithmetic on void*, which C++ refuses.
    const void* body = SPA_POD_BODY_CONST(pod);
    const std::uint32_t size = SPA_POD_BODY_SIZE(pod);
    for (auto* item = static_cast<const spa_pod*>(body); spa_pod_is_inside(body, size, item);
         item = static_cast<const spa_pod*>(spa_pod_next(item))) {
        if (!spa_pod_is_object_type(item, SPA_TYPE_OBJECT_Profiler)) {
            continue;
        }
        QVBridgeProfilerCycle cycle;
        bool haveDriver = false;
        const spa_pod_prop* prop;
        SPA_POD_OBJECT_FOREACH(reinterpret_cast<const spa_pod_object*>(item), prop) {
            switch (prop->key) {
                case SPA_PROFILER_info: {
                    int64_t counter = 0;
                    float load[3] = {};
                    int32_t xruns = 0;
                    if (spa_pod_parse_struct(&prop->value, SPA_POD_Long(&counter),
                                             SPA_POD_Float(&load[0]), SPA_POD_Float(&load[1]),
                                             SPA_POD_Float(&load[2]), SPA_POD_Int(&xruns)) >= 0) {
                        cycle.xrunCount = xruns;
                    }
                    break;
                }
                case SPA_PROFILER_clock: {
                    int32_t flags = 0, id = 0;
                    const char* name = nullptr;
                    int64_t nsec = 0, position = 0, duration = 0, delay = 0, next = 0;
                    spa_fraction rate{};
                    double rateDiff = 0;
                    if (spa_pod_parse_struct(&prop->value, SPA_POD_Int(&flags), SPA_POD_Int(&id),
                                             SPA_POD_String(&name), SPA_POD_Long(&nsec),
                                             SPA_POD_Fraction(&rate), SPA_POD_Long(&position),
                                             SPA_POD_Long(&duration), SPA_POD_Long(&delay),
                                             SPA_POD_Double(&rateDiff), SPA_POD_Long(&next)) >= 0) {
                        cycle.quantum = static_cast<std::uint32_t>(duration);
                    }
                    break;
                }
                case SPA_PROFILER_driverBlock:
                case SPA_PROFILER_followerBlock: {
                    int32_t id = 0, status = 0;
                    const char* name = nullptr;
                    int64_t prev = 0, signal = 0, awake = 0, finish = 0;
                    spa_fraction latency{};
                    if (spa_pod_parse_struct(&prop->value, SPA_POD_Int(&id), SPA_POD_String(&name),
                                             SPA_POD_Long(&prev), SPA_POD_Long(&signal),
                                             SPA_POD_Long(&awake), SPA_POD_Long(&finish),
                                             SPA_POD_Int(&status),
                                             SPA_POD_Fraction(&latency)) < 0) {
                        break;
                    }
                    if (prop->key == SPA_PROFILER_driverBlock) {
                        cycle.driverID = static_cast<std::uint32_t>(id);
                        cycle.driverName = name != nullptr ? name : "";
                        haveDriver = true;
                    } else {
                        cycle.followers.push_back({static_cast<std::uint32_t>(id), status});
                    }
                    break;
                }
                default:
                    break;
            }
        }
        if (haveDriver) {
            cycles.push_back(std::move(cycle));
        }
    }
    return cycles;
}

}  // namespace qv::bridge
