#include "QVBridgePods.h"

#include <gtest/gtest.h>
#include <spa/param/audio/format-utils.h>
#include <spa/param/profiler.h>
#include <spa/param/props.h>
#include <spa/pod/builder.h>

namespace qv::bridge {
namespace {

TEST(QVBridgePods, PropsGiveChannelVolumesAndMuteWhenPresent) {
    std::uint8_t buffer[1024];
    spa_pod_builder b = SPA_POD_BUILDER_INIT(buffer, sizeof(buffer));
    const float volumes[] = {0.125f, 0.5f};
    const auto* pod = static_cast<const spa_pod*>(spa_pod_builder_add_object(
        &b, SPA_TYPE_OBJECT_Props, SPA_PARAM_Props, SPA_PROP_mute, SPA_POD_Bool(true),
        SPA_PROP_channelVolumes, SPA_POD_Array(sizeof(float), SPA_TYPE_Float, 2, volumes)));
    const auto props = QVBridgeParseProps(pod);
    ASSERT_TRUE(props.mute && props.channelVolumes);
    EXPECT_TRUE(*props.mute);
    EXPECT_EQ(*props.channelVolumes, (std::vector<float>{0.125f, 0.5f}));

    // The adapter's second Props object holds neither: nothing is taken from it.
    spa_pod_builder b2 = SPA_POD_BUILDER_INIT(buffer, sizeof(buffer));
    const auto* other = static_cast<const spa_pod*>(spa_pod_builder_add_object(
        &b2, SPA_TYPE_OBJECT_Props, SPA_PARAM_Props, SPA_PROP_volume, SPA_POD_Float(0.5f)));
    const auto none = QVBridgeParseProps(other);
    EXPECT_FALSE(none.mute || none.channelVolumes);
    EXPECT_FALSE(QVBridgeParseProps(nullptr).mute);
}

TEST(QVBridgePods, FormatOfRawAudioOnly) {
    std::uint8_t buffer[1024];
    spa_pod_builder b = SPA_POD_BUILDER_INIT(buffer, sizeof(buffer));
    spa_audio_info_raw info{};
    info.format = SPA_AUDIO_FORMAT_S16_LE;
    info.rate = 44100;
    info.channels = 1;
    const auto format =
        QVBridgeParseFormat(spa_format_audio_raw_build(&b, SPA_PARAM_Format, &info));
    ASSERT_TRUE(format);
    EXPECT_EQ(std::tie(format->sampleFormat, format->rate, format->channels),
              std::tuple("S16LE", 44100u, 1u));
    EXPECT_FALSE(QVBridgeParseFormat(nullptr));
}

// The followers' blocks (which stream overran) are the end-to-end Xruns test's, with a slow client.
TEST(QVBridgePods, ProfileCyclesWithTheirDriverXrunsAndQuantum) {
    const spa_fraction rate = SPA_FRACTION(1, 48000);
    const spa_fraction latency = SPA_FRACTION(1024, 48000);
    std::uint8_t buffer[4096];
    spa_pod_builder b = SPA_POD_BUILDER_INIT(buffer, sizeof(buffer));
    spa_pod_frame outer;
    spa_pod_builder_push_struct(&b, &outer);
    spa_pod_frame object;
    spa_pod_builder_push_object(&b, &object, SPA_TYPE_OBJECT_Profiler, 0);
    spa_pod_builder_prop(&b, SPA_PROFILER_info, 0);
    spa_pod_builder_add_struct(&b, SPA_POD_Long(7), SPA_POD_Float(0.1f), SPA_POD_Float(0.1f),
                               SPA_POD_Float(0.1f), SPA_POD_Int(3));
    spa_pod_builder_prop(&b, SPA_PROFILER_clock, 0);
    spa_pod_builder_add_struct(&b, SPA_POD_Int(0), SPA_POD_Int(30), SPA_POD_String("speakers"),
                               SPA_POD_Long(0), SPA_POD_Fraction(&rate), SPA_POD_Long(0),
                               SPA_POD_Long(1024), SPA_POD_Long(0), SPA_POD_Double(1.0),
                               SPA_POD_Long(0));
    spa_pod_builder_prop(&b, SPA_PROFILER_driverBlock, 0);
    spa_pod_builder_add_struct(&b, SPA_POD_Int(30), SPA_POD_String("speakers"), SPA_POD_Long(0),
                               SPA_POD_Long(0), SPA_POD_Long(0), SPA_POD_Long(0), SPA_POD_Int(3),
                               SPA_POD_Fraction(&latency));
    spa_pod_builder_pop(&b, &object);
    // An object without a driver block is no cycle.
    spa_pod_builder_push_object(&b, &object, SPA_TYPE_OBJECT_Profiler, 0);
    spa_pod_builder_pop(&b, &object);
    const auto* pod = static_cast<const spa_pod*>(spa_pod_builder_pop(&b, &outer));

    const auto cycles = QVBridgeParseProfile(pod);
    ASSERT_EQ(cycles.size(), 1u);
    const auto& c = cycles[0];
    EXPECT_EQ(std::tie(c.driverID, c.driverName, c.xrunCount, c.quantum),
              std::tuple(30u, "speakers", 3, 1024u));
}

}  // namespace
}  // namespace qv::bridge
