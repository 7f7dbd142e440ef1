#include "QVBridgeMapping.h"

#include <algorithm>
#include <cctype>
#include <cmath>
#include <numeric>

#include <fmt/format.h>

namespace qv::bridge {

namespace {

std::string lower(std::string_view text) {
    std::string out(text);
    std::transform(out.begin(), out.end(), out.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return out;
}

std::string lookup(const QVBridgeProps& props, std::string_view key) {
    const auto it = props.find(key);
    return it == props.end() ? std::string() : it->second;
}

bool mentions(const std::string& haystack, std::initializer_list<std::string_view> needles) {
    return std::any_of(needles.begin(), needles.end(), [&](std::string_view needle) {
        return haystack.find(needle) != std::string::npos;
    });
}

}  // namespace

std::uint16_t QVBridgeServiceTypeForRole(std::string_view role) {
    const std::string r = lower(role);
    if (r == "music" || r == "movie") {
        return 7;
    }
    if (r == "communication" || r == "phone") {
        return 2;
    }
    if (r == "notification" || r == "event") {
        return 13;
    }
    if (r == "alarm") {
        return 4;
    }
    if (r == "game") {
        return 8;
    }
    if (r == "assistant" || r == "accessibility") {
        return 1;
    }
    return 0;
}

std::string QVBridgeApplicationID(const QVBridgeProps& node, const QVBridgeProps& client) {
    for (const char* key : {"application.id", "application.process.binary", "application.name"}) {
        for (const QVBridgeProps* props : {&node, &client}) {
            if (std::string value = lookup(*props, key); !value.empty()) {
                return value;
            }
        }
    }
    if (std::string name = lookup(node, "node.name"); !name.empty()) {
        return name;
    }
    return "Unknown";
}

double QVBridgeSessionVolume(const std::vector<float>& channelVolumes, bool muted) {
    if (muted) {
        return 0.0;
    }
    if (channelVolumes.empty()) {
        return 1.0;
    }
    const double mean =
        std::accumulate(channelVolumes.begin(), channelVolumes.end(), 0.0) / channelVolumes.size();
    const double volume = std::cbrt(std::max(mean, 0.0));
    // Six places: a cubic round trip (wpctl's 0.5 is stored as 0.125f) lands back on the value.
    return std::min(1.0, std::round(volume * 1e6) / 1e6);
}

std::string QVBridgeDeviceKind(const QVBridgeProps& node, const QVBridgeProps& device) {
    const std::string api = lower(lookup(device, "device.api") + lookup(node, "device.api"));
    if (api.find("bluez") != std::string::npos) {
        const std::string profile =
            lower(lookup(node, "api.bluez5.profile") + " " + lookup(device, "device.profile") +
                  " " + lookup(node, "device.profile.name"));
        if (mentions(profile, {"headset", "hfp", "hsp", "handsfree"})) {
            return "BluetoothHFP";
        }
        return "BluetoothA2DP";
    }
    if (lower(lookup(device, "device.bus")) == "usb" ||
        lower(lookup(node, "device.bus")) == "usb") {
        return "USB";
    }
    // What the port and the descriptions say, most specific first.
    const std::string words =
        lower(lookup(node, "port.type") + " " + lookup(device, "device.form-factor") + " " +
              lookup(node, "device.profile.description") + " " + lookup(node, "node.description") +
              " " + lookup(node, "node.name") + " " + lookup(device, "device.description"));
    if (mentions(words, {"hdmi", "displayport"})) {
        return "HDMI";
    }
    if (mentions(words, {"headphone", "headset"})) {
        return "Headphones";
    }
    if (mentions(words, {"speaker"})) {
        return "Speaker";
    }
    for (const auto& [props, key] :
         {std::pair{&device, "device.description"}, std::pair{&node, "node.description"},
          std::pair{&node, "node.name"}}) {
        if (std::string value = lookup(*props, key); !value.empty()) {
            return value;
        }
    }
    return "unknown";
}

std::string QVBridgeFormatText(std::string_view sampleFormat, std::uint32_t rate,
                               std::uint32_t channels) {
    return fmt::format("{} {} Hz {} ch", sampleFormat, rate, channels);
}

}  // namespace qv::bridge
