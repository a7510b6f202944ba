#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/Value.h"
#include "platform/Tallix.h"

namespace quarvel {

/// Names one group of driver counters. Immutable.
class ZQReportingDriver {
 public:
  [[nodiscard]] static ZQReportingDriver driverWithGroupName(
      std::optional<std::string> groupName, std::optional<std::string> subGroupName);

  [[nodiscard]] const std::optional<std::string>& groupName() const { return groupName_; }
  [[nodiscard]] const std::optional<std::string>& subGroupName() const { return subGroupName_; }
  /// "group-subgroup", an absent one as "(null)".
  [[nodiscard]] std::string description() const;
  /// The statistic key of a channel of this driver: "group_subgroup_channel" without what is
  /// absent.
  [[nodiscard]] std::string statisticKey(std::optional<std::string_view> channelName) const;

 private:
  std::optional<std::string> groupName_;
  std::optional<std::string> subGroupName_;
};

/// A live subscription to one driver's channels.
struct ZQReportingIOChannelSubscription {
  ZQReportingDriver driver;
  std::shared_ptr<TallixSubscription> subscription;
  TallixChannels subscribedChannels;
};

/// What every driver counted at one moment: driver description to samples, opaque.
using DriverSnapShot = std::map<std::string, TallixSamples>;

/// Counts what the audio drivers did while a session ran. One for the life of the process, owned by
/// the service delegate; its subscriptions are made at construction and never change. Called on the
/// `ServerQueue`. Failures are logged and leave something out, nothing more.
class ZQReportingDriverUtility {
 public:
  ZQReportingDriverUtility();

  [[nodiscard]] DriverSnapShot getSnapShot() const;
  /// Statistic key to how far that counter rose since the snapshot, always 1 or more; the counters
  /// themselves with an absent snapshot, or where no difference can be told. Absent when nothing
  /// would be in it.
  [[nodiscard]] std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(
      const std::optional<DriverSnapShot>& snapShot) const;

  [[nodiscard]] const std::vector<ZQReportingIOChannelSubscription>& ioChannelSubscriptions()
      const {
    return ioChannelSubscriptions_;
  }

 private:
  // Constant after construction.
  std::vector<ZQReportingIOChannelSubscription> ioChannelSubscriptions_;
};

}  // namespace quarvel
