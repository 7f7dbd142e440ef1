// One audio driver group of the statistics library, and one subscription to its channels.
//
// Thread safety: plain values; made once by the driver utility and only read afterwards.
#pragma once

#include <optional>
#include <string>

#include "platform/StatFeed.h"

namespace qv {

// A driver group and subgroup name pair; an absent name matches any in the library.
class QVReportingDriver {
  public:
    static QVReportingDriver driverWithGroupName(std::optional<std::string> groupName,
                                                 std::optional<std::string> subGroupName);

    const std::optional<std::string>& groupName() const { return groupName_; }
    const std::optional<std::string>& subGroupName() const { return subGroupName_; }

    // "group-subgroup", an absent name printed "(null)": the driver's key in a snapshot.
    std::string description() const;

  private:
    std::optional<std::string> groupName_;
    std::optional<std::string> subGroupName_;
};

// The library's subscription to the channels of one driver.
class QVReportingIOChannelSubscription {
  public:
    static QVReportingIOChannelSubscription initWithDriver(QVReportingDriver driver);

    const StatFeed::SubscriptionRef& subscription() const { return subscription_; }
    void setSubscription(StatFeed::SubscriptionRef subscription) {
        subscription_ = std::move(subscription);
    }
    // The channel set the library returned with the subscription.
    const StatFeed::ChannelSetRef& subscribedChannels() const { return subscribedChannels_; }
    void setSubscribedChannels(StatFeed::ChannelSetRef channels) {
        subscribedChannels_ = std::move(channels);
    }
    const QVReportingDriver& driver() const { return driver_; }

  private:
    explicit QVReportingIOChannelSubscription(QVReportingDriver driver)
        : driver_(std::move(driver)) {}

    StatFeed::SubscriptionRef subscription_;
    StatFeed::ChannelSetRef subscribedChannels_;
    QVReportingDriver driver_;
};

}  // namespace qv
