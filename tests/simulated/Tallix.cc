#include "platform/Tallix.h"

#include "tests/simulated/Simulation.h"

namespace quarvel {

/// Indices of the published ones.
class TallixChannelSet : public std::vector<std::size_t> {};
class TallixSubscription {
 public:
  TallixChannels channels;
};
class TallixChannelSample {
 public:
  SimulatedTallix::Name name;
  std::int64_t value;
};
class TallixSampleSet : public std::vector<TallixChannelSample> {};

static SimulatedTallix& Tallix() {
  return Simulation::current().tallix;
}

TallixChannels TallixCopyChannelsInGroup(std::optional<std::string_view> group,
                                         std::optional<std::string_view> subgroup,
                                         std::optional<Error>& error) {
  if (Tallix().channelsError) error = Tallix().channelsError;
  const auto matches = [](const auto& wanted, const auto& name) {
    return !wanted || (name && *wanted == *name);
  };
  std::shared_ptr<TallixChannelSet> found;
  for (std::size_t i = 0; i < Tallix().channels.size(); ++i) {
    const SimulatedTallix::Channel& channel = Tallix().channels[i];
    if (!matches(group, channel.group) || !matches(subgroup, channel.subgroup)) continue;
    if (found == nullptr) found = std::make_shared<TallixChannelSet>();
    if (channel.published) found->push_back(i);
  }
  return found;
}

std::int32_t TallixGetChannelCount(const TallixChannelSet& channels) {
  return static_cast<std::int32_t>(channels.size());
}

std::shared_ptr<TallixSubscription> TallixCreateSubscription(const TallixChannels& channels,
                                                             TallixChannels& subscribedChannels) {
  // A set of its own, so that sampling with the set that was looked up is noticed.
  subscribedChannels = std::make_shared<TallixChannelSet>(*channels);
  return std::make_shared<TallixSubscription>(TallixSubscription{subscribedChannels});
}

TallixSamples TallixCreateSamples(TallixSubscription& subscription,
                                  const TallixChannels& subscribedChannels,
                                  std::optional<Error>& error) {
  EXPECT_EQ(subscription.channels, subscribedChannels);
  if (Tallix().samplesError) {
    error = Tallix().samplesError;
    return nullptr;
  }
  auto samples = std::make_shared<TallixSampleSet>();
  for (const std::size_t i : *subscribedChannels) {
    samples->push_back({Tallix().channels[i].name, Tallix().channels[i].value});
  }
  return samples;
}

TallixSamples TallixCreateSamplesDelta(const TallixSamples& earlier, const TallixSamples& later,
                                       std::optional<Error>& error) {
  if (earlier == nullptr) {
    error =
        Error{kTallixErrorDomain, static_cast<std::int64_t>(TallixErrorCode::noEarlierSamples), {}};
    return nullptr;
  }
  auto delta = std::make_shared<TallixSampleSet>(*later);
  for (std::size_t i = 0; i < delta->size(); ++i) (*delta)[i].value -= earlier->at(i).value;
  return delta;
}

void TallixIterate(const TallixSampleSet& samples,
                   const std::function<int(const TallixChannelSample&)>& visitor) {
  for (const TallixChannelSample& sample : samples) EXPECT_EQ(visitor(sample), 0);
}

std::optional<std::string_view> TallixChannelGetChannelName(const TallixChannelSample& sample) {
  return sample.name;
}

std::int64_t TallixSimpleGetIntegerValue(const TallixChannelSample& sample) {
  return sample.value;
}

}  // namespace quarvel
