// How what PipeWire says of a stream becomes what a reporting session carries: the service type
// from the media role, the application's ID, the volume a user sees, the device kind and the
// format text. Pure functions of plain values.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <string_view>
#include <vector>

namespace qv::bridge {

using QVBridgeProps = std::map<std::string, std::string, std::less<>>;

// media.role to service type: Music, Movie -> longformaudio (7); Communication, Phone ->
// telephony (2); Notification, Event -> systemsounds (13); Alarm -> alarms (4); Game ->
// nonlongformaudio (8); Assistant, Accessibility -> vocalis (1); anything else or none ->
// generic (0). Roles compare without regard to case.
std::uint16_t QVBridgeServiceTypeForRole(std::string_view role);

// "KXHostApplicationDisplayID": application.id, else application.process.binary, else
// application.name, each looked up in the node's properties first, then its client's; else
// node.name; else "Unknown".
std::string QVBridgeApplicationID(const QVBridgeProps& node, const QVBridgeProps& client);

// The volume as a user sees it: the cube root of the mean linear channel volume (PipeWire's
// mixers show volumes on a cubic scale), 0 when muted, clamped to [0, 1]. No channels reads as
// full volume.
double QVBridgeSessionVolume(const std::vector<float>& channelVolumes, bool muted);

// "active_devices" of a stream from the node it plays to (or records from) and that node's
// device: BluetoothA2DP / BluetoothHFP for Bluetooth profiles, USB for a USB device, HDMI,
// Headphones (headsets too) or Speaker when the port, form factor or description says so, else
// the device's description (the node's when it has no device), else "unknown".
std::string QVBridgeDeviceKind(const QVBridgeProps& node, const QVBridgeProps& device);

// "session_selected_format": "F32LE 48000 Hz 2 ch".
std::string QVBridgeFormatText(std::string_view sampleFormat, std::uint32_t rate,
                               std::uint32_t channels);

}  // namespace qv::bridge
