#include "device/TallixSampling.h"

#include <fmt/format.h>

#include <algorithm>
#include <limits>
#include <map>
#include <system_error>

#include "platform/Log.h"

namespace quarvel {

namespace {

std::int64_t saturatedDifference(std::int64_t later, std::int64_t earlier) {
  std::int64_t difference = 0;
  if (!__builtin_sub_overflow(later, earlier, &difference)) return difference;
  using Limits = std::numeric_limits<std::int64_t>;
  return later < earlier ? Limits::min() : Limits::max();
}

}  // namespace

TallixSubscription::TallixSubscription(const TallixChannelSet& channels) {
  ZQ_FUNCTION("TallixCreateSubscription");
  const MutexLock lock(mutex_);
  std::map<std::filesystem::path, std::vector<const DriverChannel*>> files;
  for (const DriverChannel& channel : channels.channels) files[channel.file].push_back(&channel);

  std::map<std::filesystem::path, std::size_t> opened;
  for (const auto& [path, contents] : files) {
    const bool report = std::ranges::any_of(
        contents, [](const DriverChannel* channel) { return channel->pattern.has_value(); });
    CounterFile file(path, report ? CounterFile::Extent::lines : CounterFile::Extent::oneInteger);
    if (const int status = file.open(); status != 0) {
      for (const DriverChannel* channel : contents) {
        ZQ_LOG(nullptr, error, "driver channel {} is left out: {}", channel->description(),
               std::generic_category().message(status));
      }
      continue;
    }
    opened.emplace(path, sources_.size());
    sources_.push_back({std::move(file), {}});
  }

  std::vector<DriverChannel> subscribed;
  for (const DriverChannel& channel : channels.channels) {
    const auto source = opened.find(channel.file);
    if (source == opened.end()) continue;
    sources_[source->second].channels.push_back(subscribed.size());
    subscribed.push_back(channel);
  }
  subscribed_ = std::make_shared<const TallixChannelSet>(std::move(subscribed));
}

Result<TallixSamples> TallixSubscription::sample() {
  const MutexLock lock(mutex_);
  const std::vector<DriverChannel>& channels = subscribed_->channels;
  std::vector<std::int64_t> values(channels.size());
  for (Source& source : sources_) {
    std::string_view content;
    if (const int status = source.file.read(buffer_, content); status != 0) {
      return TallixError(
          TallixErrorCode::channelUnreadable,
          fmt::format("driver channel {}: {}", channels[source.channels.front()].description(),
                      std::generic_category().message(status)));
    }
    for (const std::size_t index : source.channels) {
      const DriverChannel& channel = channels[index];
      const std::string_view text = channel.pattern ? channel.pattern->find(content) : content;
      if (const auto fault = CounterFromText(text, values[index])) {
        return TallixError(*fault, fmt::format("driver channel {} holds {}", channel.description(),
                                               *fault == TallixErrorCode::noInteger
                                                   ? "no decimal integer"
                                                   : "an integer beyond signed 64 bits"));
      }
    }
  }
  return TallixSamples(std::make_shared<const TallixSampleSet>(subscribed_, std::move(values)));
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
        TallixError(TallixErrorCode::notSubscribed, "these channels are not the subscribed ones");
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
    error = TallixError(TallixErrorCode::noEarlierSamples, "there are no earlier samples");
    return nullptr;
  }
  if (!later || earlier->channels != later->channels) {
    error = TallixError(TallixErrorCode::differentChannels,
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
