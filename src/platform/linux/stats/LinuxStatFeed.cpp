#include "platform/linux/stats/LinuxStatFeed.h"

#include <algorithm>
#include <charconv>
#include <chrono>
#include <map>

#include "platform/Clock.h"
#include "platform/linux/stats/KernelFiles.h"
#include "platform/linux/stats/LinuxStatFeedSources.h"

namespace qv {

using namespace statfeed;

namespace {

struct Card {
    unsigned number = 0;
    std::string id;
    std::string names;  // id, driver, short and long name, lower case, for classification
};

// "N [ID             ]: DRIVER - SHORT NAME" and an indented long name on the next line.
std::vector<Card> readCards(const std::string& path) {
    std::vector<Card> cards;
    std::string text;
    if (readFile(path, text, kLargeFileBytes) != 0) {
        return cards;
    }
    std::string_view rest = text;
    while (!rest.empty()) {
        const std::size_t eol = rest.find('\n');
        const std::string_view raw = rest.substr(0, eol);
        rest = eol == std::string_view::npos ? std::string_view() : rest.substr(eol + 1);
        const std::string_view line = trim(raw);
        const std::size_t open = line.find(" [");
        const std::size_t close = line.find("]:");
        unsigned number = 0;
        if (open == std::string_view::npos || close == std::string_view::npos || close < open) {
            if (!cards.empty() && !line.empty()) {
                cards.back().names += " " + lower(line);  // the long name
            }
            continue;
        }
        const auto [end, ec] = std::from_chars(line.data(), line.data() + open, number);
        if (ec != std::errc() || end != line.data() + open) {
            continue;
        }
        Card card;
        card.number = number;
        card.id = cleanName(line.substr(open + 2, close - open - 2));
        if (card.id.empty()) {
            card.id = "card" + std::to_string(number);
        }
        card.names = lower(line.substr(open));
        cards.push_back(std::move(card));
    }
    return cards;
}

enum class AudioRole { Ordinary, Speaker, Haptics };

AudioRole roleOf(const std::string& lowerNames) {
    if (containsAny(lowerNames, {"speaker", "spk"})) {
        return AudioRole::Speaker;
    }
    if (containsAny(lowerNames, {"haptic", "vibra"})) {
        return AudioRole::Haptics;
    }
    return AudioRole::Ordinary;
}

}  // namespace

LinuxStatFeed::LinuxStatFeed(std::filesystem::path root, const Clock& clock)
    : root_(std::move(root)), clock_(clock) {}

LinuxStatFeed::~LinuxStatFeed() = default;

std::uint64_t LinuxStatFeed::idFor(const std::string& key) {
    // Called with mutex_ held.
    const auto [it, inserted] = ids_.emplace(key, ids_.size() + 1);
    return it->second;
}

std::vector<LinuxStatFeed::Published> LinuxStatFeed::discover() {
    std::vector<Published> all;
    const std::string root = root_.string();
    auto publish = [&](std::shared_ptr<StatFeedChannelInfo> info,
                       std::shared_ptr<const Source> source, int field, const std::string& key) {
        {
            std::lock_guard lock(mutex_);
            info->id = idFor(key);
        }
        all.push_back(Published{std::move(info), std::move(source), field});
    };

    // ALSA: PCM streams and power residencies of each card.
    const std::string asound = root + "/proc/asound";
    for (const Card& card : readCards(asound + "/cards")) {
        const std::string cardName = "card" + std::to_string(card.number);
        const std::string driverName = card.id + "<" + cardName + ">";
        const AudioRole role = roleOf(card.names);
        const std::string cardDir = asound + "/" + cardName;
        for (const std::string& pcm : allEntries(cardDir)) {
            if (pcm.size() < 5 || pcm.rfind("pcm", 0) != 0 ||
                (pcm.back() != 'p' && pcm.back() != 'c')) {
                continue;
            }
            const bool playback = pcm.back() == 'p';
            for (const std::string& sub : numberedEntries(cardDir + "/" + pcm, "sub")) {
                const std::string dir = cardDir + "/" + pcm + "/" + sub;
                if (!exists(dir + "/status")) {
                    continue;
                }
                std::string group = playback ? "Tx" : "Rx";
                std::string subgroup = "IOAudio2";
                if (role == AudioRole::Speaker) {
                    group = "Speaker";
                } else if (role == AudioRole::Haptics) {
                    group = "Haptics";
                    subgroup = "Stats";
                }
                auto source = std::make_shared<PcmSource>(dir + "/status", dir + "/hw_params");
                const std::string stream = cleanName(pcm + " " + sub);
                publish(makeInfo(ChannelStatsFormat::Simple, driverName, group, subgroup,
                                 stream + " frames", "frames"),
                        source, PcmSource::kFrames, dir + "#frames");
                publish(makeInfo(ChannelStatsFormat::Simple, driverName, group, subgroup,
                                 stream + " ms", "ms"),
                        source, PcmSource::kMilliseconds, dir + "#ms");
            }
        }
        const std::string power = root + "/sys/class/sound/" + cardName + "/device/power/";
        if (exists(power + "runtime_active_time")) {
            auto source = std::make_shared<StateFilesSource>(
                std::vector<StateFilesSource::State>{
                    {"active", power + "runtime_active_time", ""},
                    {"suspended", power + "runtime_suspended_time", ""}},
                1, 1);
            publish(makeInfo(ChannelStatsFormat::State, driverName, std::string(kStateGroup),
                             "runtimepm", "power", "ms"),
                    source, 0, power);
        }
    }

    // HDA codecs' power accounting.
    const std::string soundClass = root + "/sys/class/sound";
    for (const std::string& entry : allEntries(soundClass)) {
        if (entry.rfind("hwC", 0) != 0) {
            continue;
        }
        const std::string dir = soundClass + "/" + entry + "/";
        if (!exists(dir + "power_on_acct")) {
            continue;
        }
        const std::string codec = cleanName(entry);
        const std::string chip = readName(dir + "chip_name").value_or("codec");
        auto source = std::make_shared<StateFilesSource>(
            std::vector<StateFilesSource::State>{{"on", dir + "power_on_acct", ""},
                                                 {"off", dir + "power_off_acct", ""}},
            1, 1);
        publish(makeInfo(ChannelStatsFormat::State, chip + "<" + codec + ">",
                         std::string(kStateGroup), "codecpower", codec, "ms"),
                source, 0, dir);
    }

    // Interrupt lines of audio hardware.
    {
        const std::string path = root + "/proc/interrupts";
        std::map<unsigned, InterruptLine> lines;
        if (readInterrupts(path, lines, /*wantActions=*/true) == 0) {
            auto source = std::make_shared<InterruptsSource>(path);
            for (const auto& [irq, line] : lines) {
                const std::string actions = lower(line.actions);
                std::string group, subgroup;
                if (containsAny(actions, {"pdm", "dmic"})) {
                    group = "pdm", subgroup = "irq";
                } else if (containsAny(actions, {"speaker", "spk"})) {
                    group = "Speaker", subgroup = "irq";
                } else if (containsAny(actions, {"haptic", "vibra"})) {
                    group = "Haptics", subgroup = "Stats";
                } else if (containsAny(actions, {"snd", "hda", "audio", "sound", "i2s", "ssp",
                                                 "sof", "asoc", "azx", "mca"})) {
                    group = "irq", subgroup = "MCA";
                } else {
                    continue;
                }
                std::optional<std::string> driverName;
                if (!line.actions.empty()) {
                    driverName = line.actions;
                }
                publish(makeInfo(ChannelStatsFormat::Simple, driverName, group, subgroup,
                                 "irq " + std::to_string(irq), "interrupts"),
                        source, static_cast<int>(irq), path + "#" + std::to_string(irq));
            }
        }
    }

    // CPU idle states, one state channel per CPU.
    const std::string cpuDir = root + "/sys/devices/system/cpu";
    const std::string idleDriver = readName(cpuDir + "/cpuidle/current_driver").value_or("cpuidle");
    for (const std::string& cpu : numberedEntries(cpuDir, "cpu")) {
        const std::string idle = cpuDir + "/" + cpu + "/cpuidle";
        std::vector<StateFilesSource::State> states;
        for (const std::string& state : numberedEntries(idle, "state")) {
            const std::string dir = idle + "/" + state + "/";
            if (!exists(dir + "time")) {
                continue;
            }
            states.push_back({readName(dir + "name").value_or(state), dir + "time", dir + "usage"});
        }
        if (states.empty()) {
            continue;
        }
        // time counts microseconds.
        auto source = std::make_shared<StateFilesSource>(std::move(states), 1000, 1);
        publish(makeInfo(ChannelStatsFormat::State, idleDriver + "<" + cpu + ">",
                         std::string(kStateGroup), "cpuidle", cpu, "ms"),
                source, 0, idle);
    }

    // CPU frequency residencies per policy: a state channel and a histogram.
    const std::string freqDir = cpuDir + "/cpufreq";
    for (const std::string& policy : numberedEntries(freqDir, "policy")) {
        const std::string dir = freqDir + "/" + policy + "/";
        if (!exists(dir + "stats/time_in_state")) {
            continue;
        }
        const std::string driverName =
            readName(dir + "scaling_driver").value_or("cpufreq") + "<" + policy + ">";
        auto source =
            std::make_shared<CpuFreqSource>(dir + "stats/time_in_state", dir + "stats/trans_table");
        publish(makeInfo(ChannelStatsFormat::State, driverName, std::string(kStateGroup), "cpufreq",
                         policy, "ms"),
                source, CpuFreqSource::kState, dir + "#state");
        publish(makeInfo(ChannelStatsFormat::Histogram, driverName, std::string(kStateGroup),
                         "cpufreq", policy, "kHz"),
                source, CpuFreqSource::kHistogram, dir + "#histogram");
    }

    // Network devices' counters.
    const std::string net = root + "/sys/class/net";
    for (const std::string& device : allEntries(net)) {
        const std::string stats = net + "/" + device + "/statistics";
        const std::string deviceName = cleanName(device);
        for (const std::string& counter : allEntries(stats)) {
            std::string group;
            if (counter.rfind("rx_", 0) == 0 || counter == "multicast") {
                group = "Rx";
            } else if (counter.rfind("tx_", 0) == 0 || counter == "collisions") {
                group = "Tx";
            } else {
                continue;
            }
            const std::string path = stats + "/" + counter;
            publish(makeInfo(ChannelStatsFormat::Simple, deviceName, group, std::nullopt,
                             cleanName(counter),
                             counter.find("bytes") != std::string::npos ? "bytes" : "count"),
                    std::make_shared<CounterFileSource>(path), 0, path);
        }
    }
    return all;
}

StatFeedResult<StatFeed::ChannelSetRef> LinuxStatFeed::channelsInGroup(
    const std::optional<std::string>& group, const std::optional<std::string>& subgroup) {
    if (!exists(root_.string())) {
        return StatFeedError{ENOENT};
    }
    const auto now = std::chrono::steady_clock::now();
    std::shared_ptr<const Discovery> discovery;
    {
        std::lock_guard lock(mutex_);
        if (discovery_ && now - discoveredAt_ < kDiscoveryReuse) {
            discovery = discovery_;
        }
    }
    if (!discovery) {
        auto fresh = std::make_shared<Discovery>();
        for (Published& p : discover()) {
            fresh->push_back(std::make_shared<const Published>(std::move(p)));
        }
        std::lock_guard lock(mutex_);
        for (const auto& p : *fresh) {
            published_[p->info->id] = p;
        }
        discovery_ = fresh;
        discoveredAt_ = now;
        discovery = std::move(fresh);
    }
    auto set = std::make_shared<StatFeedChannelSet>();
    for (const auto& p : *discovery) {
        if ((!group || p->info->group == group) && (!subgroup || p->info->subgroup == subgroup)) {
            set->push_back(p->info);
        }
    }
    return ChannelSetRef(std::move(set));
}

namespace {

bool sameChannel(const StatFeedChannelInfo& a, const StatFeedChannelInfo& b) {
    return a.id == b.id && a.format == b.format && a.driverName == b.driverName &&
           a.group == b.group && a.subgroup == b.subgroup && a.name == b.name;
}

// A subscription: its channels grouped by source, each source read once per sample.
class LinuxSubscription final : public StatFeedSubscription {
  public:
    struct Read {
        std::shared_ptr<const Source> source;
        std::vector<Wanted> wanted;
    };
    std::vector<Read> reads;
};

}  // namespace

StatFeedResult<StatFeed::Subscribed> LinuxStatFeed::createSubscription(
    const StatFeedChannelSet& channels) {
    if (channels.empty()) {
        return StatFeedError{EINVAL};
    }
    auto subscription = std::make_shared<LinuxSubscription>();
    auto subscribed = std::make_shared<StatFeedChannelSet>();
    std::unordered_map<const Source*, std::size_t> readOf;
    {
        std::lock_guard lock(mutex_);
        for (const auto& info : channels) {
            const auto it = info ? published_.find(info->id) : published_.end();
            // A later discovery makes new descriptions of the same channels: the id and what it
            // describes must match, not the object.
            if (it == published_.end() || !sameChannel(*it->second->info, *info)) {
                return StatFeedError{EINVAL};  // not a channel of this library
            }
            const Published& p = *it->second;
            const auto [slot, inserted] =
                readOf.emplace(p.source.get(), subscription->reads.size());
            if (inserted) {
                subscription->reads.push_back({p.source, {}});
            }
            subscription->reads[slot->second].wanted.push_back({p.info, p.field});
        }
    }
    // The subscribed set in reading order, which is the order of every sample's channels.
    for (const auto& read : subscription->reads) {
        for (const Wanted& w : read.wanted) {
            subscribed->push_back(w.info);
        }
    }
    return Subscribed{std::move(subscription), std::move(subscribed)};
}

StatFeedResult<StatFeed::SamplesRef> LinuxStatFeed::createSamples(
    const StatFeedSubscription& subscription, const StatFeedChannelSet& channels) {
    const auto* mine = dynamic_cast<const LinuxSubscription*>(&subscription);
    if (mine == nullptr) {
        return StatFeedError{EINVAL};
    }
    auto samples = std::make_shared<StatFeedSamples>();
    samples->uptime = clock_.systemUptime();
    samples->channels.reserve(channels.size());
    int firstError = 0;
    for (const auto& read : mine->reads) {
        const int error = read.source->read(read.wanted, samples->uptime, samples->channels);
        if (error != 0 && firstError == 0) {
            firstError = error;
        }
    }
    if (samples->channels.empty()) {
        return StatFeedError{firstError != 0 ? firstError : EIO};
    }
    return SamplesRef(std::move(samples));
}

}  // namespace qv
