#include "platform/Tallix.h"

#include <limits>
#include <utility>

#include "platform/Log.h"
#include "platform/linux/sources/TallixFacility.h"

namespace quarvel {

namespace {

Error deltaError(TallixErrorCode code, const char* reason) {
  return Error::because(kTallixErrorDomain, static_cast<std::int64_t>(code), reason);
}

std::int64_t saturatedDifference(std::int64_t later, std::int64_t earlier) {
  std::int64_t difference = 0;
  if (!__builtin_sub_overflow(later, earlier, &difference)) return difference;
  using Limits = std::numeric_limits<std::int64_t>;
  return later < earlier ? Limits::min() : Limits::max();
}

}  // namespace

TallixChannels TallixCopyChannelsInGroup(std::optional<std::string_view> group,
                                         std::optional<std::string_view> subgroup,
                                         std::optional<Error>& error) {
  ZQ_FUNCTION("TallixCopyChannelsInGroup");
  static const TallixFacility facility(Configuration::process().tallix);
  std::optional<Error> failure;
  TallixChannels channels = facility.channelsInGroup(group, subgroup, failure);
  if (failure) {
    // Who asked logs the code alone.
    ZQ_LOG(nullptr, error, "{}", failure->description());
    error = std::move(failure);
  }
  return channels;
}

std::int32_t TallixGetChannelCount(const TallixChannelSet& channels) {
  return static_cast<std::int32_t>(channels.channels.size());
}

std::shared_ptr<TallixSubscription> TallixCreateSubscription(const TallixChannels& channels,
                                                             TallixChannels& subscribedChannels) {
  auto subscription = std::make_shared<TallixSubscription>(*channels);
  subscribedChannels = subscription->channels();
  return subscription;
}

TallixSamples TallixCreateSamples(TallixSubscription& subscription,
                                  const TallixChannels& subscribedChannels,
                                  std::optional<Error>& error) {
  ZQ_FUNCTION("TallixCreateSamples");
  if (subscribedChannels != subscription.channels()) {
    error =
        deltaError(TallixErrorCode::notSubscribed, "these channels are not the subscribed ones");
    return nullptr;
  }
  Result<TallixSamples> samples = subscription.sample();
  if (samples) return std::move(samples.value());
  ZQ_LOG(nullptr, error, "{}", samples.error().description());
  error = std::move(samples.error());
  return nullptr;
}

TallixSamples TallixCreateSamplesDelta(const TallixSamples& earlier, const TallixSamples& later,
                                       std::optional<Error>& error) {
  if (!earlier) {
    error = deltaError(TallixErrorCode::noEarlierSamples, "there are no earlier samples");
    return nullptr;
  }
  if (!later || earlier->channels != later->channels) {
    error = deltaError(TallixErrorCode::differentChannels,
                       "the samples are not of the same subscription");
    return nullptr;
  }
  std::vector<std::int64_t> differences(later->values.size());
  for (std::size_t i = 0; i < differences.size(); ++i) {
    differences[i] = saturatedDifference(later->values[i], earlier->values[i]);
  }
  return std::make_shared<const TallixSampleSet>(later->channels, std::move(differences));
}

void TallixIterate(const TallixSampleSet& samples,
                   const std::function<int(const TallixChannelSample&)>& visitor) {
  for (std::size_t i = 0; i < samples.values.size(); ++i) {
    if (visitor({samples.channels->channels[i], samples.values[i]}) != 0) return;
  }
}

std::optional<std::string_view> TallixChannelGetChannelName(const TallixChannelSample& sample) {
  if (sample.channel.name.empty()) return std::nullopt;
  return sample.channel.name;
}

std::int64_t TallixSimpleGetIntegerValue(const TallixChannelSample& sample) {
  return sample.value;
}

}  // namespace quarvel
