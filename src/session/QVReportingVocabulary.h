// The vocabulary of messages and sessions: event categories, event types and service types, with
// their display strings. The strings are part of the daemon's external output (event names,
// descriptions, summary files) and are spelled exactly as they must appear.
//
// Thread safety: every function is safe to call from any thread.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace qv {

// Lower 16 bits: the base category; upper 16 bits: an optional subsystem prefix.
using AudioEventCategory = std::uint32_t;
using AudioEventType = std::uint16_t;
using AudioServiceType = std::uint16_t;
using ReporterID = std::int64_t;

namespace category {
inline constexpr AudioEventCategory kGeneric = 1;
inline constexpr AudioEventCategory kRecord = 2;
inline constexpr AudioEventCategory kInput = 3;
inline constexpr AudioEventCategory kPlayback = 4;
inline constexpr AudioEventCategory kOutput = 5;
inline constexpr AudioEventCategory kPlaybackAndRecord = 6;
inline constexpr AudioEventCategory kIO = 7;
inline constexpr AudioEventCategory kSetup = 8;
inline constexpr AudioEventCategory kClientRequest = 9;
inline constexpr AudioEventCategory kRouteChange = 10;
inline constexpr AudioEventCategory kError = 11;
inline constexpr AudioEventCategory kChannelStats = 12;
inline constexpr AudioEventCategory kPerformance = 13;
inline constexpr AudioEventCategory kVolume = 14;
inline constexpr AudioEventCategory kOrbit = 15;
inline constexpr AudioEventCategory kHearingHealth = 16;
inline constexpr AudioEventCategory kEarlink = 17;
inline constexpr AudioEventCategory kUnknown = 0xFFFFFFFF;

inline constexpr AudioEventCategory kPrefixMIDI = 0x04000000;
inline constexpr AudioEventCategory kPrefixSession = 0x08000000;
inline constexpr AudioEventCategory kPrefixDSP = 0x10000000;
inline constexpr AudioEventCategory kPrefixHAL = 0x20000000;
inline constexpr AudioEventCategory kPrefixRouting = 0x40000000;
inline constexpr AudioEventCategory kPrefixToolbox = 0x80000000;
}  // namespace category

namespace type {
inline constexpr AudioEventType kGeneric = 0;
inline constexpr AudioEventType kStart = 1;
inline constexpr AudioEventType kStop = 2;
inline constexpr AudioEventType kActivate = 3;
inline constexpr AudioEventType kDeactivate = 4;
inline constexpr AudioEventType kSetup = 5;
inline constexpr AudioEventType kError = 6;
inline constexpr AudioEventType kIssueDetector = 7;
inline constexpr AudioEventType kEnergyLog = 8;
inline constexpr AudioEventType kPluginUsage = 9;
inline constexpr AudioEventType kMIDIDriver = 10;
inline constexpr AudioEventType kSummary = 11;
inline constexpr AudioEventType kHeadphoneAudioExposure = 12;
inline constexpr AudioEventType kAudioExposure = 13;
inline constexpr AudioEventType kListeningenhancement = 14;
inline constexpr AudioEventType kResearchFeed = 15;
inline constexpr AudioEventType kSimple = 16;
inline constexpr AudioEventType kHistogram = 17;
inline constexpr AudioEventType kState = 18;
inline constexpr AudioEventType kMemoryLog = 19;
inline constexpr AudioEventType kUnknown = 0xFFFF;
}  // namespace type

namespace service {
inline constexpr AudioServiceType kGeneric = 0;
inline constexpr AudioServiceType kVocalis = 1;
inline constexpr AudioServiceType kTelephony = 2;
inline constexpr AudioServiceType kHaptics = 3;
inline constexpr AudioServiceType kAlarms = 4;
inline constexpr AudioServiceType kStandalone = 5;
inline constexpr AudioServiceType kSoundAutoConfig = 6;
inline constexpr AudioServiceType kLongFormAudio = 7;
inline constexpr AudioServiceType kNonLongFormAudio = 8;
inline constexpr AudioServiceType kAudioDeviceUsage = 9;
inline constexpr AudioServiceType kAlerts = 10;
inline constexpr AudioServiceType kTest = 11;
inline constexpr AudioServiceType kAPIUsage = 12;
inline constexpr AudioServiceType kSystemSounds = 13;
inline constexpr AudioServiceType kUnknown = 0xFFFF;
}  // namespace service

// Display string of a category, prefix first: 0x10000008 gives "DSP_Setup".
std::string QVReportingUtilityCategoryString(AudioEventCategory category);
// Inverse of the base strings "Generic" to "HearingHealth" and "Unknown"; anything else (the
// "Earlink" string and prefixed forms included) gives 0xFFFFFFFF.
AudioEventCategory QVReportingUtilityCategoryFromString(std::string_view string);
std::string_view QVReportingUtilityTypeString(AudioEventType type);
// "Generic" to "State" and "Unknown"; anything else ("MemoryLog" included) gives 0.
AudioEventType QVReportingUtilityTypeFromString(std::string_view string);
std::string_view QVReportingUtilityGenerateServiceNameFromServiceType(AudioServiceType serviceType);
AudioServiceType QVReportingUtilityGenerateServiceTypeFromServiceName(std::string_view name);
// True when the upper half of the category is nonzero and the category is not 0xFFFFFFFF.
bool QVReportingUtilityIsABTestModeOn(AudioEventCategory category);
std::int64_t QVReportingUtilityExtractSessionIDFromReporterID(ReporterID reporterID);

}  // namespace qv
