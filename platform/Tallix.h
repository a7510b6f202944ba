#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string_view>

#include "base/Error.h"

namespace quarvel {

// The driver statistics facility: counters that drivers publish, each a channel with a name, in a
// group and perhaps a subgroup.
//
// Sets, subscriptions and samples are immutable to the caller, shared and opaque; whoever holds a
// reference may use it from any thread. All operations may be called from any thread. They read
// what the drivers publish at that moment, which is short (microseconds a channel), and wait for
// nothing else.
//
// An operation with `error` leaves it alone when all went well and otherwise fills it; what it then
// returns may be absent or incomplete, and the caller decides whether to use it.

/// What `Error::code` says; the domain is `kTallixErrorDomain`.
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
/// Channels held open for sampling. Lives as long as a reference to it.
class TallixSubscription;
/// One value for each channel of a subscription.
class TallixSampleSet;
/// One channel's value; valid while its sample set is.
class TallixChannelSample;

using TallixChannels = std::shared_ptr<const TallixChannelSet>;
using TallixSamples = std::shared_ptr<const TallixSampleSet>;

/// The channels published at this moment. An absent group matches every group; an absent subgroup
/// matches every subgroup, and the channels that are in none. Absent when the facility knows no
/// such group or subgroup; empty when it knows it but finds no channel there. Errors:
/// unreadableGroups.
[[nodiscard]] TallixChannels TallixCopyChannelsInGroup(std::optional<std::string_view> group,
                                                       std::optional<std::string_view> subgroup,
                                                       std::optional<Error>& error);

[[nodiscard]] std::int32_t TallixGetChannelCount(const TallixChannelSet& channels);

/// Subscribes to channels; `subscribedChannels` receives those that can be sampled. One that cannot
/// be opened is left out, with a log line. Never absent.
[[nodiscard]] std::shared_ptr<TallixSubscription> TallixCreateSubscription(
    const TallixChannels& channels, TallixChannels& subscribedChannels);

/// Reads every subscribed channel now. Absent, with `error`, unless all could be read.
/// Errors: channelUnreadable, noInteger, integerOutOfRange, notSubscribed.
[[nodiscard]] TallixSamples TallixCreateSamples(TallixSubscription& subscription,
                                                const TallixChannels& subscribedChannels,
                                                std::optional<Error>& error);

/// Each channel's later value minus its earlier one, kept within signed 64 bits. Absent on an
/// error. Errors: noEarlierSamples, differentChannels.
[[nodiscard]] TallixSamples TallixCreateSamplesDelta(const TallixSamples& earlier,
                                                     const TallixSamples& later,
                                                     std::optional<Error>& error);

/// Calls `visitor` once for each channel sample until it returns something other than 0. The order
/// is by group, subgroup and name, and the same for every sample set of a subscription.
void TallixIterate(const TallixSampleSet& samples,
                   const std::function<int(const TallixChannelSample&)>& visitor);

/// Absent when the facility gives the channel no name. Valid while the sample is.
[[nodiscard]] std::optional<std::string_view> TallixChannelGetChannelName(
    const TallixChannelSample& sample);

[[nodiscard]] std::int64_t TallixSimpleGetIntegerValue(const TallixChannelSample& sample);

}  // namespace quarvel
