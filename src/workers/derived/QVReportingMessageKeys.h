// Payload keys that clients send and the derived-message workers read. The names are the
// daemon's exported names; the time stamp key lives with the session, which writes it.
#pragma once

#include <string_view>

#include "session/QVReportingSession.h"

namespace qv {

// Playback and recording state.
inline constexpr std::string_view QVReportingMessageKeySessionOutputRunning =
    "session_output_running";
inline constexpr std::string_view QVReportingMessageKeySessionInputRunning =
    "session_input_running";
inline constexpr std::string_view QVReportingMessageKeySessionDuration = "session_duration";
inline constexpr std::string_view QVReportingMessageKeyIssueType = "issue_type";

// Route, format and volume.
inline constexpr std::string_view QVReportingMessageKeySelectedFormat = "session_selected_format";
inline constexpr std::string_view QVReportingMessageKeyActiveDevices = "active_devices";
inline constexpr std::string_view QVReportingMessageKeySpatializationEnabled =
    "spatializationEnabled";
inline constexpr std::string_view QVReportingMessageKeyRingerState = "ringerstate";
inline constexpr std::string_view QVReportingMessageKeyVolume = "KXSessionVolume";
inline constexpr std::string_view QVReportingMessageKeySpatialAudioAccessoryFeature =
    "spatial-audio-accessory-feature";
inline constexpr std::string_view QVReportingMessageKeyFormatID = "mFormatID";
inline constexpr std::string_view QVReportingMessageKeyChannelsPerFrame = "mChannelsPerFrame";

// Voice processing.
inline constexpr std::string_view QVReportingMessageKeyVpConfigPrimaryVocoder =
    "vp_config_primary_vocoder";
inline constexpr std::string_view QVReportingMessageKeyVpConfigPrimaryVocoderFs =
    "vp_config_primary_vocoderFs";
inline constexpr std::string_view QVReportingMessageKeyVpConfigOperationMode =
    "vp_config_operation_mode";
inline constexpr std::string_view QVReportingMessageKeyVpConfigInputPort = "vp_config_input_port";

}  // namespace qv
