#include "QVBridgeMapping.h"

#include <gtest/gtest.h>

namespace qv::bridge {
namespace {

// The end-to-end Roles test plays each known role; here, what no player sends.
TEST(QVBridgeMapping, ServiceTypeFollowsTheMediaRoleWhateverItsCase) {
    const std::pair<const char*, std::uint16_t> table[] = {
        {"", 0}, {"music", 7}, {"Musics", 0}, {"ALARM", 4}};
    for (const auto& [role, expected] : table) {
        EXPECT_EQ(QVBridgeServiceTypeForRole(role), expected) << role;
    }
}

TEST(QVBridgeMapping, ApplicationIDPrefersTheIDThenTheBinaryThenTheName) {
    struct Case {
        QVBridgeProps node, client;
        const char* expected;
    };
    const Case table[] = {
        {{{"application.id", "org.example.Player"}, {"application.name", "Player"}},
         {{"application.process.binary", "player"}},
         "org.example.Player"},
        {{{"application.name", "Player"}}, {{"application.process.binary", "player"}}, "player"},
        {{{"application.name", "Player"}}, {}, "Player"},
        {{}, {{"application.name", "From client"}}, "From client"},
        {{{"application.id", ""}, {"node.name", "alsa_playback.x"}}, {}, "alsa_playback.x"},
        {{}, {}, "Unknown"},
    };
    for (const Case& c : table) {
        EXPECT_EQ(QVBridgeApplicationID(c.node, c.client), c.expected);
    }
}

TEST(QVBridgeMapping, VolumeIsTheCubeRootOfTheMeanChannelVolumeAndZeroWhenMuted) {
    EXPECT_DOUBLE_EQ(QVBridgeSessionVolume({0.125f, 0.125f}, false), 0.5);
    // wpctl's 0.3 stored as a float cube still reads 0.3.
    EXPECT_DOUBLE_EQ(QVBridgeSessionVolume({0.3f * 0.3f * 0.3f}, false), 0.3);
    EXPECT_DOUBLE_EQ(QVBridgeSessionVolume({0.0f, 0.25f}, false), 0.5);  // mean 0.125
    EXPECT_DOUBLE_EQ(QVBridgeSessionVolume({1.0f, 1.0f}, true), 0.0);
    EXPECT_DOUBLE_EQ(QVBridgeSessionVolume({}, false), 1.0);
    EXPECT_DOUBLE_EQ(QVBridgeSessionVolume({8.0f}, false), 1.0);  // software gain above 100 %
    EXPECT_DOUBLE_EQ(QVBridgeSessionVolume({-1.0f}, false), 0.0);
}

// What the end-to-end tests' null devices' descriptions give is theirs to check.
TEST(QVBridgeMapping, DeviceKindFromProfileBusPortAndDescription) {
    struct Case {
        QVBridgeProps node, device;
        const char* expected;
    };
    const Case table[] = {
        {{{"api.bluez5.profile", "a2dp-sink"}}, {{"device.api", "bluez5"}}, "BluetoothA2DP"},
        {{{"api.bluez5.profile", "headset-head-unit"}}, {{"device.api", "bluez5"}}, "BluetoothHFP"},
        {{{"node.description", "Speakers"}}, {{"device.bus", "usb"}}, "USB"},
        {{{"node.description", "HDA Intel PCH HDMI 0"}}, {}, "HDMI"},
        {{{"node.description", "Analog Output"}},
         {{"device.form-factor", "headset"}},
         "Headphones"},
        {{{"node.description", "Line Out"}},
         {{"device.description", "Built-in Audio"}},
         "Built-in Audio"},
        {{}, {}, "unknown"},
    };
    for (const Case& c : table) {
        EXPECT_EQ(QVBridgeDeviceKind(c.node, c.device), c.expected);
    }
}

}  // namespace
}  // namespace qv::bridge
