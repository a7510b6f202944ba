#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string_view>

#include "base/Error.h"

namespace quarvel {

// The driver statistics facility: counters that drivers publish. Each is a channel with a name, in
// a group and perhaps in a subgroup.
//
// Sets, subscriptions and samples are opaque, shared and immutable to the caller. They and all
// operations may be used from any thread. An operation reads the counters as published at that
// moment, which takes microseconds a channel, and never blocks otherwise.
//
// An operation sets `error` on a fault and else leaves it alone. Its result may then be absent or
// incomplete; the caller decides whether to use it.

/// `Error::code` in the domain `kTallixErrorDomain`.
enum class TallixErrorCode : std::int64_t {
  unreadableGroups = 1,  // the groups could not be listed: there may be more channels than returned
  channelUnreadable = 2,  // a channel has vanished, or reading it failed
  noInteger = 3,          // a channel holds no integer, or its pattern matches nothing
  integerOutOfRange = 4,  // a channel's integer does not fit in signed 64 bits
  notSubscribed = 5,      // the channel set is not the one that came with the subscription
  noEarlierSamples = 6,   // a delta against an absent sample set
  differentChannels = 7,  // a delta between sample sets of different subscriptions
};
inline constexpr const char* kTallixErrorDomain = "quarvel.tallix";

class TallixChannelSet;
/// Channels that are held open for sampling, as long as a reference lives.
class TallixSubscription;
/// One value for each channel of a subscription.
class TallixSampleSet;
/// One channel's value. Part of its sample set.
class TallixChannelSample;

using TallixChannels = std::shared_ptr<const TallixChannelSet>;
using TallixSamples = std::shared_ptr<const TallixSampleSet>;

/// The channels published at this moment. An absent group matches every group; an absent subgroup
/// matches every subgroup, and channels without one. Absent when the facility knows no such group
/// or subgroup; empty when it knows it but finds no channel there. Errors: unreadableGroups.
[[nodiscard]] TallixChannels TallixCopyChannelsInGroup(std::optional<std::string_view> group,
                                                       std::optional<std::string_view> subgroup,
                                                       std::optional<Error>& error);

/// The number of channels in a set.
[[nodiscard]] std::int32_t TallixGetChannelCount(const TallixChannelSet& channels);

/// Subscribes to channels; `subscribedChannels` receives the ones that can be sampled. A channel
/// that cannot be opened is left out, with a log line. Never absent.
[[nodiscard]] std::shared_ptr<TallixSubscription> TallixCreateSubscription(
    const TallixChannels& channels, TallixChannels& subscribedChannels);

/// Reads every subscribed channel now. Absent, with `error`, when one cannot be read.
/// Errors: channelUnreadable, noInteger, integerOutOfRange, notSubscribed.
[[nodiscard]] TallixSamples TallixCreateSamples(TallixSubscription& subscription,
                                                const TallixChannels& subscribedChannels,
                                                std::optional<Error>& error);

/// Each channel's later value minus its earlier one, kept within signed 64 bits. Absent on an
/// error. Errors: noEarlierSamples, differentChannels.
[[nodiscard]] TallixSamples TallixCreateSamplesDelta(const TallixSamples& earlier,
                                                     const TallixSamples& later,
                                                     std::optional<Error>& error);

/// Calls `visitor` once for each channel sample until it returns a number other than 0. The order
/// is by group, subgroup and name, and the same for every sample set of a subscription.
void TallixIterate(const TallixSampleSet& samples,
                   const std::function<int(const TallixChannelSample&)>& visitor);

/// Absent when the facility gives the channel no name. Valid while the sample is.
[[nodiscard]] std::optional<std::string_view> TallixChannelGetChannelName(
    const TallixChannelSample& sample);

/// The counter's value, or its difference in a delta.
[[nodiscard]] std::int64_t TallixSimpleGetIntegerValue(const TallixChannelSample& sample);

}  // namespace quarvel
