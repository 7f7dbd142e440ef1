#include "session/QVReportingVocabulary.h"

#include <array>
#include <string>
#include <unordered_map>
#include <utility>

namespace qv {

namespace {

constexpr std::array<std::string_view, 18> kCategoryStrings = {
    "Undefined",         "Generic",     "Record", "Input",         "Playback",      "Output",
    "PlaybackAndRecord", "IO",          "Setup",  "ClientRequest", "RouteChange",   "Error",
    "ChannelStats",      "Performance", "Volume", "Orbit",         "HearingHealth", "Earlink"};

constexpr std::array<std::string_view, 20> kTypeStrings = {"Generic",
                                                           "Start",
                                                           "Stop",
                                                           "Activate",
                                                           "Deactivate",
                                                           "Setup",
                                                           "Error",
                                                           "IssueDetector",
                                                           "EnergyLog",
                                                           "PluginUsage",
                                                           "MIDIDriver",
                                                           "Summary",
                                                           "HeadphoneAudioExposure",
                                                           "AudioExposure",
                                                           "Listeningenhancement",
                                                           "ResearchFeed",
                                                           "Simple",
                                                           "Histogram",
                                                           "State",
                                                           "MemoryLog"};

constexpr std::array<std::string_view, 14> kServiceNames = {
    "generic",          "vocalis",          "telephony",       "haptics",
    "alarms",           "standalone",       "soundautoconfig", "longformaudio",
    "nonlongformaudio", "audiodeviceusage", "alerts",          "test",
    "apiusage",         "systemsounds"};

constexpr std::array<std::pair<AudioEventCategory, std::string_view>, 6> kPrefixes = {{
    {category::kPrefixMIDI, "MIDI"},
    {category::kPrefixSession, "Session"},
    {category::kPrefixDSP, "DSP"},
    {category::kPrefixHAL, "HAL"},
    {category::kPrefixRouting, "Routing"},
    {category::kPrefixToolbox, "Toolbox"},
}};

bool inPrefixedRange(AudioEventCategory category) {
    return category >= 0x00010000u && category <= 0xFFFFFFFEu;
}

}  // namespace

std::string QVReportingUtilityCategoryString(AudioEventCategory category) {
    std::string out;
    if (inPrefixedRange(category)) {
        const AudioEventCategory masked = category & 0xFFFF0000u;
        for (const auto& [value, prefix] : kPrefixes) {
            if (value == masked) {
                out += prefix;
                break;
            }
        }
        // Also for a prefix we do not know, so such categories stand out as "_Name".
        out += '_';
    }
    const AudioEventCategory base = category & 0xFFFFu;
    out += (base >= 1 && base <= 17) ? kCategoryStrings[base] : kCategoryStrings[0];
    return out;
}

AudioEventCategory QVReportingUtilityCategoryFromString(std::string_view string) {
    // Built once; "Earlink" has no row on purpose, so it reads back as unknown.
    static const auto* const table = [] {
        auto* t = new std::unordered_map<std::string_view, AudioEventCategory>;
        for (AudioEventCategory c = 1; c <= 16; ++c) {
            t->emplace(kCategoryStrings[c], c);
        }
        t->emplace("Unknown", category::kUnknown);
        return t;
    }();
    auto it = table->find(string);
    return it == table->end() ? category::kUnknown : it->second;
}

std::string_view QVReportingUtilityTypeString(AudioEventType type) {
    if (type == type::kUnknown) {
        return "Unknown";
    }
    return (type >= 1 && type <= 19) ? kTypeStrings[type] : kTypeStrings[0];
}

AudioEventType QVReportingUtilityTypeFromString(std::string_view string) {
    // Built once; "MemoryLog" has no row on purpose, so it reads back as Generic.
    static const auto* const table = [] {
        auto* t = new std::unordered_map<std::string_view, AudioEventType>;
        for (AudioEventType ty = 0; ty <= 18; ++ty) {
            t->emplace(kTypeStrings[ty], ty);
        }
        t->emplace("Unknown", type::kUnknown);
        return t;
    }();
    auto it = table->find(string);
    return it == table->end() ? type::kGeneric : it->second;
}

std::string_view QVReportingUtilityGenerateServiceNameFromServiceType(
    AudioServiceType serviceType) {
    return serviceType < kServiceNames.size() ? kServiceNames[serviceType] : "unknown";
}

AudioServiceType QVReportingUtilityGenerateServiceTypeFromServiceName(std::string_view name) {
    // Case-sensitive: "Telephony" is not a service name.
    for (std::size_t i = 0; i < kServiceNames.size(); ++i) {
        if (kServiceNames[i] == name) {
            return static_cast<AudioServiceType>(i);
        }
    }
    return service::kUnknown;
}

bool QVReportingUtilityIsABTestModeOn(AudioEventCategory category) {
    return inPrefixedRange(category);
}

std::int64_t QVReportingUtilityExtractSessionIDFromReporterID(ReporterID reporterID) {
    return reporterID;
}

}  // namespace qv
