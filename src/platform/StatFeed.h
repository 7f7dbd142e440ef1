// The driver-statistics reporting library (StatFeed): drivers publish statistics channels
// (simple counters, state residencies, histograms), each with a driver name, a group, a subgroup,
// a channel name and a unit. A client asks for the channels of a group and subgroup, subscribes
// to them, takes samples of the subscription and the difference of two samples, and reads each
// channel of a sample through the accessors below.
//
// Ownership: channel sets, subscriptions and samples are immutable once made and shared by
// reference count; a copy of one is a copy of the reference. A channel read through iterate() is
// valid while its samples are.
//
// Errors are codes (errno values for the Linux implementation), carried by StatFeedResult.
//
// Thread safety: every member may be called from any thread; implementations keep no state that
// a call changes except what they guard themselves.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <variant>
#include <vector>

namespace qv {

// What kind of data a channel carries. Values are the library's own numbers.
enum class ChannelStatsFormat : std::uint8_t {
    Invalid = 0,
    Simple = 1,
    State = 2,
    Histogram = 3,
    SimpleArray = 4,
};

// A failed call's code.
struct StatFeedError {
    long code = 0;
};

// A value or the code of the error that prevented it.
template <typename T>
class StatFeedResult {
  public:
    StatFeedResult(T value) : v_(std::move(value)) {}
    StatFeedResult(StatFeedError error) : v_(error) {}

    bool ok() const { return v_.index() == 0; }
    // REQUIRES: ok().
    const T& value() const { return std::get<0>(v_); }
    T& value() { return std::get<0>(v_); }
    // 0 when ok().
    long error() const { return ok() ? 0 : std::get<1>(v_).code; }

  private:
    std::variant<T, StatFeedError> v_;
};

// What the library publishes about one channel; fixed once published. Any of the names may be
// absent.
struct StatFeedChannelInfo {
    // Unique within one library: the same channel keeps its id across queries.
    std::uint64_t id = 0;
    ChannelStatsFormat format = ChannelStatsFormat::Invalid;
    std::optional<std::string> driverName;
    std::optional<std::string> group;
    std::optional<std::string> subgroup;
    std::optional<std::string> name;
    std::optional<std::string> unit;
    // State channels: residency units per second of elapsed time, for duty cycles (1000 for
    // residencies in milliseconds).
    double residencyUnitsPerSecond = 1000.0;
};

struct StatFeedState {
    std::string name;
    std::uint64_t transitions = 0;  // times the state was entered
    std::uint64_t residency = 0;    // time spent in it, in the channel's unit
    double dutyCycle = 0.0;         // residency as a fraction of the time covered, 0 to 1
};

struct StatFeedBucket {
    std::int64_t lower = 0;
    std::int64_t upper = 0;
    std::uint64_t hits = 0;
    // Nonzero when the bounds of this bucket cannot be given; the code is the error.
    long boundsError = 0;
};

// One channel as a sample holds it: what it is and what it read.
struct StatFeedChannel {
    std::shared_ptr<const StatFeedChannelInfo> info;
    std::uint64_t simple = 0;             // Simple: the counter (kernel counters are unsigned)
    std::vector<StatFeedState> states;    // State
    std::vector<StatFeedBucket> buckets;  // Histogram
    std::int64_t minimum = 0;             // Histogram: the smallest value recorded
    std::int64_t maximum = 0;             // Histogram: the largest value recorded
};

// The channels a query matched, in the library's order.
using StatFeedChannelSet = std::vector<std::shared_ptr<const StatFeedChannelInfo>>;

// A subscription's handle; what it holds is the implementation's business.
class StatFeedSubscription {
  public:
    virtual ~StatFeedSubscription() = default;
};

// The readings of a subscription's channels at one moment, or the difference of two.
struct StatFeedSamples {
    std::vector<StatFeedChannel> channels;
    // Seconds since boot when the sample was taken; for a delta, the seconds it covers.
    double uptime = 0.0;
    bool isDelta = false;
};

class StatFeed {
  public:
    using ChannelSetRef = std::shared_ptr<const StatFeedChannelSet>;
    using SubscriptionRef = std::shared_ptr<const StatFeedSubscription>;
    using SamplesRef = std::shared_ptr<const StatFeedSamples>;
    struct Subscribed {
        SubscriptionRef subscription;
        ChannelSetRef channels;  // the channels the subscription covers
    };

    virtual ~StatFeed() = default;

    // The channels whose group and subgroup match; an absent name matches any. An empty set is
    // not an error.
    virtual StatFeedResult<ChannelSetRef> channelsInGroup(
        const std::optional<std::string>& group, const std::optional<std::string>& subgroup) = 0;
    virtual std::size_t channelCount(const StatFeedChannelSet& channels) const;
    virtual StatFeedResult<Subscribed> createSubscription(const StatFeedChannelSet& channels) = 0;
    // Reads the subscription's channels now. A channel that cannot be read is left out; when no
    // channel can be read the call fails.
    virtual StatFeedResult<SamplesRef> createSamples(const StatFeedSubscription& subscription,
                                                     const StatFeedChannelSet& channels) = 0;
    // later minus earlier, channel by channel (see StatFeedComputeDelta).
    virtual StatFeedResult<SamplesRef> createSamplesDelta(const StatFeedSamples& earlier,
                                                          const StatFeedSamples& later);
    // Calls visit once per channel, in order.
    virtual void iterate(const StatFeedSamples& samples,
                         const std::function<void(const StatFeedChannel&)>& visit) const;

    // Per channel.
    virtual ChannelStatsFormat channelFormat(const StatFeedChannel& channel) const;
    virtual const std::optional<std::string>& channelDriverName(
        const StatFeedChannel& channel) const;
    virtual const std::optional<std::string>& channelGroup(const StatFeedChannel& channel) const;
    virtual const std::optional<std::string>& channelSubgroup(const StatFeedChannel& channel) const;
    virtual const std::optional<std::string>& channelName(const StatFeedChannel& channel) const;
    virtual const std::optional<std::string>& channelUnit(const StatFeedChannel& channel) const;

    // Simple channels: the value, saturated at the largest signed 64-bit number.
    virtual std::int64_t simpleValue(const StatFeedChannel& channel) const;

    // State channels.
    virtual std::size_t stateCount(const StatFeedChannel& channel) const;
    // REQUIRES: index < stateCount(channel).
    virtual const StatFeedState& stateValues(const StatFeedChannel& channel,
                                             std::size_t index) const;

    // Histogram channels.
    virtual std::size_t bucketCount(const StatFeedChannel& channel) const;
    // REQUIRES: index < bucketCount(channel). Lower and upper bound, or the error.
    virtual StatFeedResult<std::pair<std::int64_t, std::int64_t>> bucketBounds(
        const StatFeedChannel& channel, std::size_t index) const;
    virtual std::uint64_t bucketHits(const StatFeedChannel& channel, std::size_t index) const;
    virtual std::int64_t histogramMinimum(const StatFeedChannel& channel) const;
    virtual std::int64_t histogramMaximum(const StatFeedChannel& channel) const;
};

// The difference of two samples of one subscription, as every implementation computes it:
// - only channels present in both (matched by id) are in the result, in later's order;
// - counters (simple values, transitions, residencies, bucket hits) are later minus earlier; a
//   counter that went backwards (wrapped, or reset when its source restarted) gives 0, never a
//   negative or a huge positive number;
// - a state's duty cycle is its residency difference over the time the delta covers, clamped to
//   0..1 (0 when no time passed);
// - a histogram keeps later's bounds, minimum and maximum; one whose bucket layout changed
//   between the two samples is left out;
// - a state channel whose state names changed is left out.
// Fails with EINVAL when either argument is itself a delta.
StatFeedResult<StatFeed::SamplesRef> StatFeedComputeDelta(const StatFeedSamples& earlier,
                                                          const StatFeedSamples& later);

}  // namespace qv
