#include "Statistics/ZQReportingDriverUtility.h"

#include <atomic>
#include <utility>

#include "Statistics/ZQReportingUtility.h"
#include "base/Format.h"
#include "platform/Log.h"

namespace quarvel {

namespace {

/// The scope "zqrd", registered by the utility's construction; the default log before.
std::atomic<LogHandle> driverScope{nullptr};
LogHandle Scope() {
  return driverScope.load(std::memory_order_relaxed);
}

}  // namespace

ZQReportingDriver ZQReportingDriver::driverWithGroupName(std::optional<std::string> groupName,
                                                         std::optional<std::string> subGroupName) {
  ZQReportingDriver driver;
  driver.groupName_ = std::move(groupName);
  driver.subGroupName_ = std::move(subGroupName);
  return driver;
}

std::string ZQReportingDriver::description() const {
  return Described(groupName_) + '-' + Described(subGroupName_);
}

std::string ZQReportingDriver::statisticKey(std::optional<std::string_view> channelName) const {
  std::string key;
  if (groupName_) key += *groupName_ + '_';
  if (subGroupName_) key += *subGroupName_ + '_';
  if (channelName) key += *channelName;
  return key;
}

ZQReportingDriverUtility::ZQReportingDriverUtility() {
  ZQ_FUNCTION("-[ZQReportingDriverUtility init]");
  driverScope = ZQLogRegister(FourCharacterCode("zqrd"), "zqrd", kSubsystem,
                              "reporting_driver_verbose", 1, 31);
  ZQ_LOG(Scope(), info, "creating tallixing driver utility");
  const ZQReportingDriver drivers[] = {
      ZQReportingDriver::driverWithGroupName("VorrenMXDrv", std::nullopt),
      ZQReportingDriver::driverWithGroupName("Speaker", std::nullopt),
      // Found by its subgroup, in any group.
      ZQReportingDriver::driverWithGroupName(std::nullopt, "MCA"),
      ZQReportingDriver::driverWithGroupName("Haptics", "Stats"),
  };
  for (const ZQReportingDriver& driver : drivers) {
    std::optional<Error> error;
    const TallixChannels channels =
        TallixCopyChannelsInGroup(driver.groupName(), driver.subGroupName(), error);
    if (error) {
      ZQ_LOG(Scope(), error, "error {} getting channels for driver {}", error->code,
             driver.description());
    }
    if (channels == nullptr) continue;
    if (TallixGetChannelCount(*channels) < 1) {
      ZQ_LOG(Scope(), info, "couldn't find any channels for driver group {}", driver.description());
    } else {
      TallixChannels subscribedChannels;
      auto subscription = TallixCreateSubscription(channels, subscribedChannels);
      ioChannelSubscriptions_.push_back(
          {driver, std::move(subscription), std::move(subscribedChannels)});
    }
    // Written for every group that was found, subscribed or not. The doubled word is deliberate.
    ZQ_LOG(Scope(), standard, "subscribed to group group {}", driver.description());
  }
}

DriverSnapShot ZQReportingDriverUtility::getSnapShot() const {
  ZQ_FUNCTION("-[ZQReportingDriverUtility getSnapShot]");
  DriverSnapShot snapShot;
  for (const auto& [driver, subscription, subscribedChannels] : ioChannelSubscriptions_) {
    const std::string description = driver.description();
    ZQ_LOG(Scope(), info, "sampling driver {}", description);
    std::optional<Error> error;
    TallixSamples samples = TallixCreateSamples(*subscription, subscribedChannels, error);
    if (error) {
      ZQ_LOG(Scope(), error, "TallixCreateSamples error {}", error->code);
    } else if (samples != nullptr) {
      snapShot.insert_or_assign(description, std::move(samples));
    }
  }
  return snapShot;
}

std::optional<Dictionary> ZQReportingDriverUtility::getDriverStatisticsRelativeToSnapShot(
    const std::optional<DriverSnapShot>& snapShot) const {
  ZQ_FUNCTION("-[ZQReportingDriverUtility getDriverStatisticsRelativeToSnapShot:]");
  Dictionary statistics;
  for (const auto& each : ioChannelSubscriptions_) {
    const ZQReportingDriver& driver = each.driver;
    std::optional<Error> error;
    ZQ_LOG(Scope(), info, "getting latest samples");
    const TallixSamples latest =
        TallixCreateSamples(*each.subscription, each.subscribedChannels, error);
    ZQ_LOG(Scope(), info, "done getting latest samples");
    if (error) {
      ZQ_LOG(Scope(), error, "TallixCreateSamples error {}", error->code);
      continue;
    }
    if (latest == nullptr) continue;
    TallixSamples figures = latest;
    if (snapShot) {
      const auto earlier = snapShot->find(driver.description());
      figures = TallixCreateSamplesDelta(earlier == snapShot->end() ? nullptr : earlier->second,
                                         latest, error);
      if (error) {
        ZQ_LOG(Scope(), error, "TallixCreateSamplesDelta error {}", error->code);
        figures = latest;
      }
    }
    if (figures == nullptr) continue;
    TallixIterate(*figures, [&statistics, &driver](const TallixChannelSample& sample) {
      const std::int64_t value = TallixSimpleGetIntegerValue(sample);
      if (value >= 1) {
        statistics.set(driver.statisticKey(TallixChannelGetChannelName(sample)), value);
      }
      return 0;
    });
  }
  return statistics.empty() ? std::nullopt : std::optional(std::move(statistics));
}

}  // namespace quarvel
