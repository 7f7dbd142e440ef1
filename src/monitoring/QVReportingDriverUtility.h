// The driver-statistics sampler: subscribes once per process to a fixed list of audio driver
// groups of the statistics library, takes snapshots of them, and turns the difference between a
// snapshot and the present into up to three ChannelStats messages (Simple, Histogram, State)
// sent into a session.
//
// The subscription list is built once, when the utility is made (the first session start of a
// snapshot worker), and only read afterwards; a driver that had no channels then is never tried
// again. Logs go to the "qvrd" category.
//
// Thread safety: after construction every member is const and may be called from any thread;
// sendDriverLogsForSession() must run where the session lives (the server queue).
#pragma once

#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "monitoring/QVReportingDriver.h"
#include "platform/StatFeed.h"
#include "values/Value.h"

namespace qv {

class QVReportingSession;

class QVReportingDriverUtility {
  public:
    // A driver's description to the samples taken of its subscription.
    using Snapshot = std::map<std::string, StatFeed::SamplesRef>;

    // What a delta report sends: one dictionary per kind of channel.
    struct DriverStats {
        Dictionary simple;
        Dictionary histogram;
        Dictionary state;
    };

    // The process's utility, made with feed on the first call; later calls return it whatever
    // feed they pass.
    static std::shared_ptr<QVReportingDriverUtility> sharedUtility(StatFeed& feed);
    // The process's utility, or null before the first sharedUtility().
    static std::shared_ptr<QVReportingDriverUtility> existingUtility();
    // For tests only: forgets the process's utility, so the next sharedUtility() makes one.
    static void TEST_reset();

    // init: subscribes to every driver of driverList() that has channels.
    explicit QVReportingDriverUtility(StatFeed& feed);

    // The drivers subscribed to, in order: group and subgroup, an absent name matching any.
    static std::vector<QVReportingDriver> driverList();

    const std::vector<QVReportingIOChannelSubscription>& ioChannelSubscriptions() const {
        return ioChannelSubscriptions_;
    }

    // Samples every subscription now.
    Snapshot getSnapShot() const;

    // Samples every subscription now and sends, into session, the difference from driverSnapShot
    // as ChannelStats messages; without a snapshot nothing is compared and nothing sent.
    void sendDriverLogsForSession(const std::shared_ptr<QVReportingSession>& session,
                                  const Snapshot* driverSnapShot) const;
    // The same report without sending it.
    DriverStats computeDriverStats(const Snapshot* driverSnapShot) const;

    // Each adds the channel's entry, if it has one, to driverStats.
    void processSimpleData(const StatFeedChannel& channel, Dictionary& driverStats) const;
    void processHistogramData(const StatFeedChannel& channel, Dictionary& driverStats) const;
    void processStateData(const StatFeedChannel& channel, Dictionary& driverStats) const;

    // "driver_group_subgroup_Type_name", the separators removed from each part, "<..." cut off
    // the driver name, absent parts left out with their "_".
    std::string getDriverStatsKey(const StatFeedChannel& channel, std::string_view type) const;

  private:
    StatFeed& feed_;
    std::vector<QVReportingIOChannelSubscription> ioChannelSubscriptions_;
};

}  // namespace qv
