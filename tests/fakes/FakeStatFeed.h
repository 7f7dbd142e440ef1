// A driver-statistics library in memory: the test publishes channels and sets what they read;
// samples copy the current readings. Failures are switched on per call kind.
#pragma once

#include <cerrno>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/StatFeed.h"

namespace qv::test {

class FakeStatFeed : public StatFeed {
  public:
    struct Reading {
        std::uint64_t simple = 0;
        std::vector<StatFeedState> states;
        std::vector<StatFeedBucket> buckets;
    };

    // Publishes a channel and returns its id.
    std::uint64_t publish(ChannelStatsFormat format, std::optional<std::string> driverName,
                          std::optional<std::string> group, std::optional<std::string> subgroup,
                          std::optional<std::string> name,
                          std::optional<std::string> unit = std::nullopt) {
        std::lock_guard lock(mutex_);
        auto info = std::make_shared<StatFeedChannelInfo>();
        info->id = channels_.size() + 1;
        info->format = format;
        info->driverName = std::move(driverName);
        info->group = std::move(group);
        info->subgroup = std::move(subgroup);
        info->name = std::move(name);
        info->unit = std::move(unit);
        channels_.push_back(info);
        readings_[info->id] = Reading{};
        return info->id;
    }

    // The current reading of a channel, for the test to change.
    template <typename F>
    void update(std::uint64_t id, F change) {
        std::lock_guard lock(mutex_);
        change(readings_.at(id));
    }
    void setSimple(std::uint64_t id, std::uint64_t value) {
        update(id, [&](Reading& r) { r.simple = value; });
    }
    void advanceUptime(double seconds) {
        std::lock_guard lock(mutex_);
        uptime_ += seconds;
    }

    // Failures: channelsInGroup for a "group-subgroup" description ("(null)" for an absent
    // name), every createSubscription, every createSamples while set.
    void failChannelsFor(const std::string& description, long code) {
        std::lock_guard lock(mutex_);
        channelErrors_[description] = code;
    }
    void failSamples(long code) {
        std::lock_guard lock(mutex_);
        samplesError_ = code;
    }

    int channelsInGroupCalls() const {
        std::lock_guard lock(mutex_);
        return channelsInGroupCalls_;
    }
    int createSamplesCalls() const {
        std::lock_guard lock(mutex_);
        return createSamplesCalls_;
    }

    StatFeedResult<ChannelSetRef> channelsInGroup(
        const std::optional<std::string>& group,
        const std::optional<std::string>& subgroup) override {
        std::lock_guard lock(mutex_);
        ++channelsInGroupCalls_;
        const std::string description =
            group.value_or("(null)") + "-" + subgroup.value_or("(null)");
        if (const auto it = channelErrors_.find(description); it != channelErrors_.end()) {
            return StatFeedError{it->second};
        }
        auto set = std::make_shared<StatFeedChannelSet>();
        for (const auto& info : channels_) {
            if ((!group || info->group == group) && (!subgroup || info->subgroup == subgroup)) {
                set->push_back(info);
            }
        }
        return ChannelSetRef(std::move(set));
    }

    StatFeedResult<Subscribed> createSubscription(const StatFeedChannelSet& channels) override {
        std::lock_guard lock(mutex_);
        auto subscription = std::make_shared<Subscription>();
        for (const auto& info : channels) {
            subscription->ids.push_back(info->id);
        }
        return Subscribed{std::move(subscription),
                          std::make_shared<const StatFeedChannelSet>(channels)};
    }

    StatFeedResult<SamplesRef> createSamples(const StatFeedSubscription& subscription,
                                             const StatFeedChannelSet&) override {
        std::lock_guard lock(mutex_);
        ++createSamplesCalls_;
        if (samplesError_ != 0) {
            return StatFeedError{samplesError_};
        }
        auto samples = std::make_shared<StatFeedSamples>();
        samples->uptime = uptime_;
        for (const std::uint64_t id : dynamic_cast<const Subscription&>(subscription).ids) {
            const Reading& r = readings_.at(id);
            StatFeedChannel c;
            c.info = channels_[id - 1];
            c.simple = r.simple;
            c.states = r.states;
            c.buckets = r.buckets;
            samples->channels.push_back(std::move(c));
        }
        if (samples->channels.empty()) {
            return StatFeedError{EIO};
        }
        return SamplesRef(std::move(samples));
    }

  private:
    struct Subscription : StatFeedSubscription {
        std::vector<std::uint64_t> ids;
    };

    mutable std::mutex mutex_;
    std::vector<std::shared_ptr<StatFeedChannelInfo>> channels_;
    std::map<std::uint64_t, Reading> readings_;
    std::map<std::string, long> channelErrors_;
    long samplesError_ = 0;
    double uptime_ = 1000.0;
    int channelsInGroupCalls_ = 0;
    int createSamplesCalls_ = 0;
};

}  // namespace qv::test
