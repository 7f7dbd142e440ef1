#include "QVBridgeMapping.h"

#include <gtest/gtest.h>

namespace qv::bridge {
namespace {

TEST(QVBridgeMapping, ServiceTypeFollowsTheMediaRole) {
    const std::pair<const char*, std::uint16_t> table[] = {
        {"Music", 7},         {"Movie", 7},   {"Communication", 2}, {"Phone", 2},
        {"Notification", 13}, {"Event", 13},  {"Alarm", 4},         {"Game", 8},
        {"Assistant", 1},     {"Accessibility", 1}, {"", 0},        {"Production", 0},
        {"music", 7},         {"Musics", 0},
    };
    for (const auto& [role, expected] : table) {
        EXPECT_EQ(QVBridgeServiceTypeForRole(role), expected) << role;
    }
}

}  // namespace
}  // namespace qv::bridge
