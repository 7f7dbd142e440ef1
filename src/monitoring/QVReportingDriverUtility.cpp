#include "monitoring/QVReportingDriverUtility.h"

#include <fmt/format.h>

#include <algorithm>
#include <mutex>

#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingSessionMessage.h"
#include "session/QVReportingVocabulary.h"

namespace qv {

namespace {

std::string_view textOf(const std::optional<std::string>& name) {
    return name ? std::string_view(*name) : std::string_view("(null)");
}

// A key part: the name without "_" and " ", so that "_" separates parts only.
void appendPart(std::string& key, std::string_view part) {
    for (const char c : part) {
        if (c != '_' && c != ' ') {
            key.push_back(c);
        }
    }
    key.push_back('_');
}

std::mutex gSharedMutex;
std::shared_ptr<QVReportingDriverUtility> gShared;  // guarded by gSharedMutex

}  // namespace

std::shared_ptr<QVReportingDriverUtility> QVReportingDriverUtility::sharedUtility(StatFeed& feed) {
    std::lock_guard lock(gSharedMutex);
    if (!gShared) {
        gShared = std::make_shared<QVReportingDriverUtility>(feed);
    }
    return gShared;
}

std::shared_ptr<QVReportingDriverUtility> QVReportingDriverUtility::existingUtility() {
    std::lock_guard lock(gSharedMutex);
    return gShared;
}

void QVReportingDriverUtility::TEST_reset() {
    std::lock_guard lock(gSharedMutex);
    gShared.reset();
}

std::vector<QVReportingDriver> QVReportingDriverUtility::driverList() {
    using D = QVReportingDriver;
    return {
        D::driverWithGroupName("KorvaneAE2MCA", std::nullopt),
        D::driverWithGroupName("Speaker", std::nullopt),
        D::driverWithGroupName(std::nullopt, "MCA"),
        D::driverWithGroupName("Haptics", "Stats"),
        D::driverWithGroupName("StateTransitionTimes_ms", std::nullopt),
        D::driverWithGroupName("Rx", std::nullopt),
        D::driverWithGroupName("Tx", std::nullopt),
        D::driverWithGroupName(std::nullopt, "IOAudio2"),
        D::driverWithGroupName("pdm", std::nullopt),
    };
}

QVReportingDriverUtility::QVReportingDriverUtility(StatFeed& feed) : feed_(feed) {
    QVLOG_INFO(QVReportingDriverUtilityCategory(), "creating channelstats driver utility");
    for (QVReportingDriver& driver : driverList()) {
        const auto channels = feed_.channelsInGroup(driver.groupName(), driver.subGroupName());
        if (!channels.ok()) {
            QVLOG_ERROR(QVReportingDriverUtilityCategory(),
                        "error {} getting channels for driver {}-{}", channels.error(),
                        textOf(driver.groupName()), textOf(driver.subGroupName()));
            continue;
        }
        if (!channels.value() || feed_.channelCount(*channels.value()) < 1) {
            QVLOG_INFO(QVReportingDriverUtilityCategory(),
                       "couldn't find any channels for driver group {}-{}",
                       textOf(driver.groupName()), textOf(driver.subGroupName()));
            continue;
        }
        auto subscription = QVReportingIOChannelSubscription::initWithDriver(driver);
        const auto subscribed = feed_.createSubscription(*channels.value());
        if (!subscribed.ok() || !subscribed.value().subscription || !subscribed.value().channels) {
            QVLOG_ERROR(QVReportingDriverUtilityCategory(),
                        "error {} creating subscription for {}-{}", subscribed.error(),
                        textOf(driver.groupName()), textOf(driver.subGroupName()));
            continue;
        }
        subscription.setSubscription(subscribed.value().subscription);
        // The channel set is immutable: holding it is holding a copy.
        subscription.setSubscribedChannels(subscribed.value().channels);
        ioChannelSubscriptions_.push_back(std::move(subscription));
        QVLOG_INFO(QVReportingDriverUtilityCategory(), "subscribed to group group {}-{}",
                   textOf(driver.groupName()), textOf(driver.subGroupName()));
    }
}

QVReportingDriverUtility::Snapshot QVReportingDriverUtility::getSnapShot() const {
    Snapshot snapshot;
    for (const auto& s : ioChannelSubscriptions_) {
        const std::string description = s.driver().description();
        QVLOG_INFO(QVReportingDriverUtilityCategory(), "sampling driver {}", description);
        auto samples = feed_.createSamples(*s.subscription(), *s.subscribedChannels());
        if (!samples.ok()) {
            QVLOG_ERROR(QVReportingDriverUtilityCategory(), "StatFeedCreateSamples error {}",
                        samples.error());
            continue;
        }
        snapshot[description] = std::move(samples.value());
    }
    return snapshot;
}

QVReportingDriverUtility::DriverStats QVReportingDriverUtility::computeDriverStats(
    const Snapshot* driverSnapShot) const {
    DriverStats stats;
    for (const auto& s : ioChannelSubscriptions_) {
        QVLOG_INFO(QVReportingDriverUtilityCategory(), "getting latest samples");
        const auto current = feed_.createSamples(*s.subscription(), *s.subscribedChannels());
        QVLOG_INFO(QVReportingDriverUtilityCategory(), "done getting latest samples");
        if (!current.ok()) {
            QVLOG_ERROR(QVReportingDriverUtilityCategory(), "StatFeedCreateSamples error {}",
                        current.error());
            continue;
        }
        if (driverSnapShot == nullptr) {
            continue;
        }
        const auto start = driverSnapShot->find(s.driver().description());
        if (start == driverSnapShot->end() || !start->second) {
            // No start samples (their sampling failed): the library refuses a null argument.
            QVLOG_ERROR(QVReportingDriverUtilityCategory(), "StatFeedCreateSamples error {}",
                        EINVAL);
            continue;
        }
        const auto delta = feed_.createSamplesDelta(*start->second, *current.value());
        if (!delta.ok()) {
            QVLOG_ERROR(QVReportingDriverUtilityCategory(), "StatFeedCreateSamples error {}",
                        delta.error());
            continue;
        }
        feed_.iterate(*delta.value(), [&](const StatFeedChannel& channel) {
            const ChannelStatsFormat format = feed_.channelFormat(channel);
            switch (format) {
                case ChannelStatsFormat::Simple:
                    processSimpleData(channel, stats.simple);
                    break;
                case ChannelStatsFormat::State:
                    processStateData(channel, stats.state);
                    break;
                case ChannelStatsFormat::Histogram:
                    processHistogramData(channel, stats.histogram);
                    break;
                case ChannelStatsFormat::Invalid:
                case ChannelStatsFormat::SimpleArray:
                    QVLOG_INFO(QVReportingDriverUtilityCategory(),
                               "Dropping sample of type : {} for group : {} "
                               "subgroup : {}",
                               static_cast<unsigned>(format), textOf(feed_.channelGroup(channel)),
                               textOf(feed_.channelSubgroup(channel)));
                    break;
                default:
                    QVLOG_ERROR(QVReportingDriverUtilityCategory(),
                                "The ChannelStatsFormat {} is not supported "
                                "group : {} subgroup : {}",
                                static_cast<unsigned>(format), textOf(feed_.channelGroup(channel)),
                                textOf(feed_.channelSubgroup(channel)));
                    break;
            }
        });
    }
    return stats;
}

void QVReportingDriverUtility::sendDriverLogsForSession(
    const std::shared_ptr<QVReportingSession>& session, const Snapshot* driverSnapShot) const {
    DriverStats stats = computeDriverStats(driverSnapShot);
    if (!session) {
        return;
    }
    const std::pair<Dictionary*, AudioEventType> messages[] = {
        {&stats.simple, type::kSimple},
        {&stats.histogram, type::kHistogram},
        {&stats.state, type::kState},
    };
    for (const auto& [payload, messageType] : messages) {
        if (payload->empty()) {
            continue;
        }
        session->sendMessage(QVReportingSessionMessage::initWithMessage(
            std::move(*payload), category::kChannelStats, messageType));
    }
}

void QVReportingDriverUtility::processSimpleData(const StatFeedChannel& channel,
                                                 Dictionary& driverStats) const {
    const std::int64_t value = feed_.simpleValue(channel);
    // Zero and negative differences are no news.
    if (value < 1) {
        return;
    }
    driverStats.set(getDriverStatsKey(channel, "Simple"), Value(value));
}

void QVReportingDriverUtility::processHistogramData(const StatFeedChannel& channel,
                                                    Dictionary& driverStats) const {
    const std::size_t count = feed_.bucketCount(channel);
    if (count == 0) {
        return;
    }
    // Bounds start from 0: lower is never above 0 and upper never below.
    std::int64_t lower = 0;
    std::int64_t upper = 0;
    std::string buckets;
    for (std::size_t i = 0; i < count; ++i) {
        const auto bounds = feed_.bucketBounds(channel, i);
        if (!bounds.ok()) {
            QVLOG_ERROR(QVReportingDriverUtilityCategory(),
                        "Error in getting the bucket bounds : {}",
                        static_cast<int>(bounds.error()));
            continue;
        }
        const auto [low, high] = bounds.value();
        lower = std::min(lower, low);
        upper = std::max(upper, high);
        const std::uint64_t hits = feed_.bucketHits(channel, i);
        if (hits != 0) {
            fmt::format_to(std::back_inserter(buckets), "{}-{}:{};", low, high,
                           static_cast<long long>(hits));
        }
    }
    if (buckets.empty()) {
        return;
    }
    buckets.pop_back();  // the last ";"
    driverStats.set(
        getDriverStatsKey(channel, "Histogram"),
        Value(fmt::format("count={},lower={},upper={},min={},max={},unit={}::{}",
                          static_cast<int>(count), lower, upper, feed_.histogramMinimum(channel),
                          feed_.histogramMaximum(channel), textOf(feed_.channelUnit(channel)),
                          buckets)));
}

void QVReportingDriverUtility::processStateData(const StatFeedChannel& channel,
                                                Dictionary& driverStats) const {
    const std::size_t count = feed_.stateCount(channel);
    std::string data;
    for (std::size_t i = 0; i < count; ++i) {
        const StatFeedState& state = feed_.stateValues(channel, i);
        if (state.residency == 0) {
            continue;
        }
        fmt::format_to(std::back_inserter(data),
                       "name:{},transition:{},residency:{},duty_cycle:{:f};", state.name,
                       state.transitions, state.residency, state.dutyCycle);
    }
    // A channel that spent no time in any state did not change: no entry, as for a histogram
    // without hits.
    if (data.empty()) {
        return;
    }
    QVLOG_DEBUG(QVReportingDriverUtilityCategory(), "the current reported data is : {}", data);
    driverStats.set(getDriverStatsKey(channel, "State"), Value(std::move(data)));
}

std::string QVReportingDriverUtility::getDriverStatsKey(const StatFeedChannel& channel,
                                                        std::string_view type) const {
    std::string key;
    if (const auto& driver = feed_.channelDriverName(channel)) {
        appendPart(key, std::string_view(*driver).substr(0, driver->find('<')));
    }
    if (const auto& group = feed_.channelGroup(channel)) {
        appendPart(key, *group);
    }
    if (const auto& subgroup = feed_.channelSubgroup(channel)) {
        appendPart(key, *subgroup);
    }
    key.append(type);
    if (const auto& name = feed_.channelName(channel)) {
        key.push_back('_');
        appendPart(key, *name);
        key.pop_back();
    }
    return key;
}

}  // namespace qv
