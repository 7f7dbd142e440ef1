#include "platform/StatFeed.h"

#include <algorithm>
#include <cerrno>
#include <limits>
#include <unordered_map>

namespace qv {

namespace {

std::uint64_t counterDelta(std::uint64_t earlier, std::uint64_t later) {
    return later >= earlier ? later - earlier : 0;
}

bool sameStateNames(const std::vector<StatFeedState>& a, const std::vector<StatFeedState>& b) {
    return std::equal(
        a.begin(), a.end(), b.begin(), b.end(),
        [](const StatFeedState& x, const StatFeedState& y) { return x.name == y.name; });
}

bool sameBucketLayout(const std::vector<StatFeedBucket>& a, const std::vector<StatFeedBucket>& b) {
    return std::equal(a.begin(), a.end(), b.begin(), b.end(),
                      [](const StatFeedBucket& x, const StatFeedBucket& y) {
                          return x.lower == y.lower && x.upper == y.upper &&
                                 x.boundsError == y.boundsError;
                      });
}

// later minus earlier for one channel; false when the two cannot be compared.
bool channelDelta(const StatFeedChannel& earlier, const StatFeedChannel& later, double seconds,
                  StatFeedChannel& out) {
    out.info = later.info;
    switch (later.info->format) {
        case ChannelStatsFormat::State: {
            if (!sameStateNames(earlier.states, later.states)) {
                return false;
            }
            const double units = seconds * later.info->residencyUnitsPerSecond;
            out.states.reserve(later.states.size());
            for (std::size_t i = 0; i < later.states.size(); ++i) {
                StatFeedState s;
                s.name = later.states[i].name;
                s.transitions =
                    counterDelta(earlier.states[i].transitions, later.states[i].transitions);
                s.residency = counterDelta(earlier.states[i].residency, later.states[i].residency);
                s.dutyCycle = units > 0
                                  ? std::clamp(static_cast<double>(s.residency) / units, 0.0, 1.0)
                                  : 0.0;
                out.states.push_back(std::move(s));
            }
            return true;
        }
        case ChannelStatsFormat::Histogram: {
            if (!sameBucketLayout(earlier.buckets, later.buckets)) {
                return false;
            }
            out.buckets = later.buckets;
            for (std::size_t i = 0; i < out.buckets.size(); ++i) {
                out.buckets[i].hits = counterDelta(earlier.buckets[i].hits, later.buckets[i].hits);
            }
            out.minimum = later.minimum;
            out.maximum = later.maximum;
            return true;
        }
        default:
            // Simple channels and the formats nobody reads the value of.
            out.simple = counterDelta(earlier.simple, later.simple);
            return true;
    }
}

}  // namespace

StatFeedResult<StatFeed::SamplesRef> StatFeedComputeDelta(const StatFeedSamples& earlier,
                                                          const StatFeedSamples& later) {
    if (earlier.isDelta || later.isDelta) {
        return StatFeedError{EINVAL};
    }
    auto delta = std::make_shared<StatFeedSamples>();
    delta->isDelta = true;
    delta->uptime = std::max(0.0, later.uptime - earlier.uptime);
    delta->channels.reserve(later.channels.size());

    // Samples of one subscription hold their channels in the same order: try the same position
    // first and look the id up only when that fails.
    std::unordered_map<std::uint64_t, std::size_t> byId;
    auto findEarlier = [&](std::size_t position, std::uint64_t id) -> const StatFeedChannel* {
        if (position < earlier.channels.size() && earlier.channels[position].info->id == id) {
            return &earlier.channels[position];
        }
        if (byId.empty()) {
            for (std::size_t i = 0; i < earlier.channels.size(); ++i) {
                byId.emplace(earlier.channels[i].info->id, i);
            }
        }
        const auto it = byId.find(id);
        return it == byId.end() ? nullptr : &earlier.channels[it->second];
    };

    for (std::size_t i = 0; i < later.channels.size(); ++i) {
        const StatFeedChannel& now = later.channels[i];
        const StatFeedChannel* before = findEarlier(i, now.info->id);
        if (before == nullptr) {
            continue;
        }
        StatFeedChannel out;
        if (channelDelta(*before, now, delta->uptime, out)) {
            delta->channels.push_back(std::move(out));
        }
    }
    return StatFeed::SamplesRef(std::move(delta));
}

std::size_t StatFeed::channelCount(const StatFeedChannelSet& channels) const {
    return channels.size();
}

StatFeedResult<StatFeed::SamplesRef> StatFeed::createSamplesDelta(const StatFeedSamples& earlier,
                                                                  const StatFeedSamples& later) {
    return StatFeedComputeDelta(earlier, later);
}

void StatFeed::iterate(const StatFeedSamples& samples,
                       const std::function<void(const StatFeedChannel&)>& visit) const {
    for (const StatFeedChannel& channel : samples.channels) {
        visit(channel);
    }
}

ChannelStatsFormat StatFeed::channelFormat(const StatFeedChannel& channel) const {
    return channel.info->format;
}

const std::optional<std::string>& StatFeed::channelDriverName(
    const StatFeedChannel& channel) const {
    return channel.info->driverName;
}

const std::optional<std::string>& StatFeed::channelGroup(const StatFeedChannel& channel) const {
    return channel.info->group;
}

const std::optional<std::string>& StatFeed::channelSubgroup(const StatFeedChannel& channel) const {
    return channel.info->subgroup;
}

const std::optional<std::string>& StatFeed::channelName(const StatFeedChannel& channel) const {
    return channel.info->name;
}

const std::optional<std::string>& StatFeed::channelUnit(const StatFeedChannel& channel) const {
    return channel.info->unit;
}

std::int64_t StatFeed::simpleValue(const StatFeedChannel& channel) const {
    constexpr auto kMax = static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max());
    return static_cast<std::int64_t>(std::min(channel.simple, kMax));
}

std::size_t StatFeed::stateCount(const StatFeedChannel& channel) const {
    return channel.states.size();
}

const StatFeedState& StatFeed::stateValues(const StatFeedChannel& channel,
                                           std::size_t index) const {
    return channel.states[index];
}

std::size_t StatFeed::bucketCount(const StatFeedChannel& channel) const {
    return channel.buckets.size();
}

StatFeedResult<std::pair<std::int64_t, std::int64_t>> StatFeed::bucketBounds(
    const StatFeedChannel& channel, std::size_t index) const {
    const StatFeedBucket& bucket = channel.buckets[index];
    if (bucket.boundsError != 0) {
        return StatFeedError{bucket.boundsError};
    }
    return std::pair{bucket.lower, bucket.upper};
}

std::uint64_t StatFeed::bucketHits(const StatFeedChannel& channel, std::size_t index) const {
    return channel.buckets[index].hits;
}

std::int64_t StatFeed::histogramMinimum(const StatFeedChannel& channel) const {
    return channel.minimum;
}

std::int64_t StatFeed::histogramMaximum(const StatFeedChannel& channel) const {
    return channel.maximum;
}

}  // namespace qv
