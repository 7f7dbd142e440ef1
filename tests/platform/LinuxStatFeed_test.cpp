#include "platform/linux/stats/LinuxStatFeed.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <string>

#include "fakes/FakeClock.h"
#include "fakes/MemoryLogSink.h"
#include "fakes/TempDirectory.h"
#include "fixtures/LaptopSysfsFixture.h"
#include "monitoring/QVReportingDriverUtility.h"

namespace qv {
namespace {

using test::LaptopSysfsFixture;

class TheLinuxStatFeed : public ::testing::Test {
  protected:
    test::TempDirectory dir{"qvsysfs"};
    test::FakeClock clock;
    test::ScopedMemoryLog log;
};

TEST_F(TheLinuxStatFeed, ReportsWhatMovedOnALaptopBetweenTwoSnapshotsAndNothingElse) {
    LaptopSysfsFixture fx(dir.path());
    LinuxStatFeed feed(dir.path(), clock);
    QVReportingDriverUtility utility(feed);
    // Every driver group but the platform's own engine has channels here.
    EXPECT_EQ(utility.ioChannelSubscriptions().size(), 8u);

    const auto start = utility.getSnapShot();
    ASSERT_EQ(start.size(), 8u);

    fx.setNetCounter("lo", "tx_packets", 1000 + 22 * 17 + 3);
    fx.setNetCounter("enp0s31f6", "rx_errors", 5);  // went backwards: reset, not negative
    fx.setPcmRunning(2, "pcm0p", 4800);             // the speaker opened
    fx.setPcmClosed(1, "pcm1c");                    // the microphone closed: back to 0
    fx.setInterrupts(LaptopSysfsFixture::kDmicIrq, 501);
    fx.setInterrupts(LaptopSysfsFixture::kSpeakerIrq, 502);
    fx.setInterrupts(LaptopSysfsFixture::kHapticsIrq, 503);
    fx.setIdleState(0, 2, 3000000 + 500000, 300 + 7);  // 500 ms more in C2
    fx.setTimeInState(1, {100, 200, 350, 0, 0, 50, 10, 20});
    fx.write("sys/class/sound/card0/device/power/runtime_active_time", "1300\n");
    clock.advance(2.0);

    const auto stats = utility.computeDriverStats(&start);
    const Dictionary expectedSimple{
        {"Speaker_Speaker_IOAudio2_Simple_pcm0psub0frames", 4800},
        {"Speaker_Speaker_IOAudio2_Simple_pcm0psub0ms", 100},
        {"dmic-pdm_pdm_irq_Simple_irq149", 4},
        {"tas2781-speaker_Speaker_irq_Simple_irq150", 8},
        {"cs40l26-haptics_Haptics_Stats_Simple_irq151", 12},
        {"lo_Tx_Simple_txpackets", 3},
    };
    EXPECT_EQ(stats.simple, expectedSimple);
    // The histogram's text is the end-to-end driver statistics test's, which moves the same policy.
    EXPECT_EQ(stats.histogram.size(), 1u);
    EXPECT_EQ(stats.state, (Dictionary{
                               {"PCH_StateTransitionTimesms_runtimepm_State_power",
                                "name:active,transition:0,residency:300,duty_cycle:0.150000;"},
                               {"intelidle_StateTransitionTimesms_cpuidle_State_cpu0",
                                "name:C2_ACPI,transition:7,residency:500,duty_cycle:0.250000;"},
                               {"intelcpufreq_StateTransitionTimesms_cpufreq_State_policy1",
                                "name:1200000 kHz,transition:0,residency:500,duty_cycle:0.250000;"
                                "name:3200000 kHz,transition:0,residency:200,duty_cycle:0.100000;"},
                           }));
}

TEST_F(TheLinuxStatFeed, LeavesOutCountersItCannotReadAndKeepsOddNamesInTheirKeys) {
    LaptopSysfsFixture fx(dir.path());
    const std::string longName(250, 'n');
    for (const std::string& device : {std::string("we<ird_ name"), longName}) {
        fx.setNetCounter(device, "rx_bytes", 10);
    }
    // Garbage in place of counters: empty, negative, words, a directory, a number too large.
    fx.write(LaptopSysfsFixture::netCounter("wwan0", "rx_packets"), "");
    fx.write(LaptopSysfsFixture::netCounter("wwan0", "rx_dropped"), "-5\n");
    fx.write(LaptopSysfsFixture::netCounter("wwan0", "rx_errors"), "lots\n");
    fx.write(LaptopSysfsFixture::netCounter("wwan0", "rx_bytes"), "99999999999999999999999\n");
    std::filesystem::remove(dir.path() / LaptopSysfsFixture::netCounter("tun0", "rx_bytes"));
    std::filesystem::create_directories(dir.path() /
                                        LaptopSysfsFixture::netCounter("tun0", "rx_bytes"));
    fx.write("proc/asound/card0/pcm3p/sub0/status", "state: RUNNING\nno pointer here\n");
    fx.write(LaptopSysfsFixture::idleState(3, 1) + "time", "garbage\n");
    // No cpufreq at all, and a cards list with lines that are not cards.
    std::filesystem::remove_all(dir.path() / "sys/devices/system/cpu/cpufreq");
    fx.write("proc/asound/cards",
             "--- no soundcards ---\n 0 [PCH            ]: HDA-Intel - HDA Intel PCH\n"
             " x [bad]: nothing\n");

    LinuxStatFeed feed(dir.path(), clock);
    QVReportingDriverUtility utility(feed);
    const auto start = utility.getSnapShot();

    // Every one of them moves, but only the readable ones can say by how much.
    fx.setNetCounter("we<ird_ name", "rx_bytes", 25);
    fx.setNetCounter(longName, "rx_bytes", 11);
    fx.setNetCounter("wwan0", "rx_packets", 50);  // unreadable at start: no difference
    fx.setNetCounter("wwan0", "rx_dropped", 50);
    fx.setIdleState(3, 1, 9999999, 999);
    clock.advance(1.0);
    const auto stats = utility.computeDriverStats(&start);
    EXPECT_EQ(stats.simple,
              (Dictionary{{"we_Rx_Simple_rxbytes", 15}, {longName + "_Rx_Simple_rxbytes", 1}}));
    EXPECT_TRUE(stats.histogram.empty());
    EXPECT_TRUE(stats.state.empty());
}

TEST_F(TheLinuxStatFeed, FailsWhereNothingCanBeReadAndTheDaemonGoesOn) {
    // No tree at all: every driver is an error, nothing is subscribed.
    {
        LinuxStatFeed feed(dir.path() / "missing", clock);
        QVReportingDriverUtility utility(feed);
        EXPECT_TRUE(utility.ioChannelSubscriptions().empty());
        EXPECT_TRUE(log->contains("error 2 getting channels for driver Rx-(null)"));
        EXPECT_TRUE(utility.getSnapShot().empty());
    }
    // A device that goes after subscribing is the end-to-end DriverStatistics test's part.
    LaptopSysfsFixture fx(dir.path());
    LinuxStatFeed feed(dir.path(), clock);
    const auto channels = feed.channelsInGroup(std::string("Tx"), std::nullopt);
    ASSERT_TRUE(channels.ok());
    const auto lo = std::make_shared<StatFeedChannelSet>();
    for (const auto& info : *channels.value()) {
        if (info->driverName == "lo") {
            lo->push_back(info);
        }
    }
    ASSERT_EQ(lo->size(), 11u);  // tx_* and collisions

    // Channels of another library are refused, however their ids fall.
    for (const std::uint64_t id : {lo->front()->id, std::uint64_t{999999}}) {
        auto foreign = std::make_shared<StatFeedChannelInfo>(*lo->front());
        foreign->id = id;
        foreign->name = "not here";
        EXPECT_EQ(feed.createSubscription({foreign}).error(), EINVAL);
    }
}

}  // namespace
}  // namespace qv
