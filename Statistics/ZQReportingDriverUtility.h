#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/Value.h"
#include "platform/Tallix.h"

namespace quarvel {

/// Names one group of driver counters. A value, immutable.
class ZQReportingDriver {
 public:
  /// A driver's group, and its subgroup. An absent name matches every group or subgroup; at least
  /// one of the two is present.
  [[nodiscard]] static ZQReportingDriver driverWithGroupName(
      std::optional<std::string> groupName, std::optional<std::string> subGroupName);

  /// The names as given. Valid while the driver lives.
  [[nodiscard]] const std::optional<std::string>& groupName() const { return groupName_; }
  [[nodiscard]] const std::optional<std::string>& subGroupName() const { return subGroupName_; }
  /// "group-subgroup", an absent one as "(null)".
  [[nodiscard]] std::string description() const;
  /// The statistic key of a channel of this driver: "group_subgroup_channel", where an absent part
  /// is left out.
  [[nodiscard]] std::string statisticKey(std::optional<std::string_view> channelName) const;

 private:
  std::optional<std::string> groupName_;
  std::optional<std::string> subGroupName_;
};

/// A subscription to one driver's channels, held by the utility.
struct ZQReportingIOChannelSubscription {
  ZQReportingDriver driver;
  std::shared_ptr<TallixSubscription> subscription;  // keeps the channels open for sampling
  TallixChannels subscribedChannels;                 // the channels that can be sampled
};

/// The counters of all drivers at one moment: driver description to opaque samples.
using DriverSnapShot = std::map<std::string, TallixSamples>;

/// Takes snapshots of the audio drivers' counters and reports how far they rose during a session.
/// Owned by the service delegate; it subscribes at construction. Called on the `ServerQueue`, which
/// it holds for some microseconds a channel. A driver that fails is logged and left out.
class ZQReportingDriverUtility {
 public:
  /// Looks the channels of the four audio drivers up and subscribes to them. Drivers that publish
  /// no channel by then are left out for the life of the process.
  ZQReportingDriverUtility();

  /// Samples every driver now.
  [[nodiscard]] DriverSnapShot getSnapShot() const;
  /// Statistic key to the counter's rise since the snapshot, always at least 1. With an absent
  /// snapshot, or when no difference can be computed, the counter itself. Absent instead of empty.
  [[nodiscard]] std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(
      const std::optional<DriverSnapShot>& snapShot) const;

  /// One subscription for each driver that was found. From any thread; valid while the utility
  /// lives.
  [[nodiscard]] const std::vector<ZQReportingIOChannelSubscription>& ioChannelSubscriptions()
      const {
    return ioChannelSubscriptions_;
  }

 private:
  // Constant after construction.
  std::vector<ZQReportingIOChannelSubscription> ioChannelSubscriptions_;
};

}  // namespace quarvel
