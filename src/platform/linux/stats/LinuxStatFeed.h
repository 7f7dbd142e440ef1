// The driver-statistics library on Linux: channels made from kernel counters, read under a root
// directory that stands for "/" (the daemon's --sysfs-root; tests point it at a fixture tree).
//
// What is published (source: format, driver name, group / subgroup, channel name). The driver
// list of the snapshot worker subscribes by these groups; an absent part is left out of a key.
//
// - /proc/asound/cardN/pcmDp/subS/status, hw_ptr: simple, "ID<cardN>", "Tx" / "IOAudio2",
//   "pcmDp subS frames"; the same in milliseconds (rate from hw_params): "pcmDp subS ms".
//   Capture streams (pcmDc) likewise in "Rx" / "IOAudio2". Streams of a card that is a speaker
//   are in "Speaker" / "IOAudio2", of a haptics device in "Haptics" / "Stats".
// - /sys/class/sound/cardN/device/power/runtime_{active,suspended}_time: state, "ID<cardN>",
//   "StateTransitionTimes_ms" / "runtimepm", "power", states active and suspended.
// - /sys/class/sound/hwCNDM/power_{on,off}_acct: state, "CHIP<hwCNDM>",
//   "StateTransitionTimes_ms" / "codecpower", "hwCNDM", states on and off.
// - /sys/devices/system/cpu/cpuN/cpuidle/stateK/{name,usage,time}: state, "DRIVER<cpuN>",
//   "StateTransitionTimes_ms" / "cpuidle", "cpuN", one state per K.
// - /sys/devices/system/cpu/cpufreq/policyN/stats/time_in_state (and trans_table): state,
//   "DRIVER<policyN>", "StateTransitionTimes_ms" / "cpufreq", "policyN", one state per
//   frequency; and the same residencies as a histogram over frequency (kHz, one bucket per
//   frequency, its bounds both that frequency).
// - /proc/interrupts, one simple channel per line whose actions belong to audio ("irq N", the
//   driver name being the line's action list): audio controllers in "irq" / "MCA", PDM or
//   digital microphones ("pdm", "dmic") in "pdm" / "irq", speaker amplifiers ("speaker",
//   "spk") in "Speaker" / "irq", haptics drivers ("haptic", "vibra") in "Haptics" / "Stats".
// - /sys/class/net/IF/statistics/*: simple, "IF", the file's name as channel name: rx_* and
//   multicast in "Rx", tx_* and collisions in "Tx", no subgroup.
//
// - ID is the card's id from /proc/asound/cards; a card is a speaker when its id or names
//   contain "speaker" or "spk", a haptics device when they contain "haptic" or "vibra" (case
//   ignored). CHIP is the codec's chip_name; DRIVER is cpuidle's current_driver or the policy's
//   scaling_driver. The "<...>" part names the instance; channel keys cut it off.
// - Audio controller interrupt lines are those whose actions mention snd, hda, audio, sound,
//   i2s, ssp, sof, asoc, azx or mca. Other lines are not published.
// - Nothing maps to the group "KorvaneAE2MCA": it has no channels.
// - A card's playback streams are in "Tx" and in "IOAudio2" at once, so a client subscribed to
//   both sees them twice, under one key.
// - Residencies are in milliseconds (cpuidle's microseconds divided, cpufreq's 10 ms ticks
//   multiplied); transitions are cpuidle's usage and the column sums of cpufreq's trans_table
//   (0 where the kernel keeps no count). A duty cycle is the residency over the time covered:
//   since boot for a sample, between the two samples for a delta (uptime from the Clock).
// - A closed PCM stream reads 0 frames; a counter lower at the end than at the start (a stream
//   reopened, a wrapped or reset counter) gives a delta of 0, which is not reported.
// - A file that cannot be read, is empty, or holds no unsigned decimal number leaves its channel
//   out of that sample; a sample in which no channel can be read fails with the first error.
// - Names are trimmed, control characters become '?', and each is cut at 255 bytes.
//
// Channels are discovered afresh by channelsInGroup(), except that queries within a second of a
// discovery reuse it (a client lists several groups in a burst); a channel keeps its id for the
// life of the object. Samples read only the files of the subscription, each once.
//
// Thread safety: every member may be called from any thread. Reading is done on the caller's
// thread: these are small in-memory kernel files, read in well under a millisecond each.
#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/StatFeed.h"

namespace qv {

class Clock;

class LinuxStatFeed final : public StatFeed {
  public:
    // root stands for "/"; clock gives the uptime that duty cycles are computed against.
    LinuxStatFeed(std::filesystem::path root, const Clock& clock);
    ~LinuxStatFeed() override;

    StatFeedResult<ChannelSetRef> channelsInGroup(
        const std::optional<std::string>& group,
        const std::optional<std::string>& subgroup) override;
    StatFeedResult<Subscribed> createSubscription(const StatFeedChannelSet& channels) override;
    StatFeedResult<SamplesRef> createSamples(const StatFeedSubscription& subscription,
                                             const StatFeedChannelSet& channels) override;

    struct Source;
    struct Published;

  private:
    // Every channel the tree offers now, in a fixed order.
    std::vector<Published> discover();
    std::uint64_t idFor(const std::string& key);

    using Discovery = std::vector<std::shared_ptr<const Published>>;
    static constexpr std::chrono::seconds kDiscoveryReuse{1};

    const std::filesystem::path root_;
    const Clock& clock_;
    std::mutex mutex_;
    std::unordered_map<std::string, std::uint64_t> ids_;  // guarded by mutex_
    // Every channel ever discovered, by id: what subscriptions are made from.
    std::unordered_map<std::uint64_t, std::shared_ptr<const Published>> published_;  // mutex_
    std::shared_ptr<const Discovery> discovery_;                                     // mutex_
    std::chrono::steady_clock::time_point discoveredAt_;                             // mutex_
};

}  // namespace qv
