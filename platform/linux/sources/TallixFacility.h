#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/Error.h"
#include "base/Mutex.h"
#include "platform/Tallix.h"
#include "platform/linux/sources/CounterFile.h"
#include "platform/linux/system/Configuration.h"

namespace quarvel {

/// Where one channel's integer is to be found.
struct DriverChannel {
  std::string group, subgroup, name;  // no subgroup, no name: empty
  std::filesystem::path file;
  std::optional<CounterPattern> pattern;

  /// For messages: "group/subgroup/name (file)".
  [[nodiscard]] std::string description() const;
};

class TallixChannelSet {
 public:
  explicit TallixChannelSet(std::vector<DriverChannel> list) : channels(std::move(list)) {}
  const std::vector<DriverChannel> channels;
};

class TallixChannelSample {
 public:
  const DriverChannel& channel;
  std::int64_t value;
};

class TallixSampleSet {
 public:
  TallixSampleSet(TallixChannels set, std::vector<std::int64_t> list)
      : channels(std::move(set)), values(std::move(list)) {}
  const TallixChannels channels;
  const std::vector<std::int64_t> values;  // one a channel, in their order
};

class TallixSubscription {
 public:
  /// Opens the files of `channels`; those that cannot be opened are logged and left out.
  explicit TallixSubscription(const TallixChannelSet& channels);

  [[nodiscard]] const TallixChannels& channels() const { return subscribed_; }
  /// Reads every file once, however many channels it holds.
  [[nodiscard]] Result<TallixSamples> sample();

 private:
  struct Source {
    CounterFile file;
    std::vector<std::size_t> channels;  // their places in `subscribed_`
  };

  TallixChannels subscribed_;  // constant after construction
  Mutex mutex_;                // held while the files are read
  std::vector<Source> sources_ QUARVEL_GUARDED_BY(mutex_);
  std::string buffer_ QUARVEL_GUARDED_BY(mutex_);
};

/// Finds channels: a tree of files ROOT/<group>/<channel> and ROOT/<group>/<subgroup>/<channel>,
/// one integer each, and the single channels of the configuration. A single one takes the place of
/// one in the tree that has the same group, subgroup and name. Symbolic links are followed, hidden
/// files are not looked at. Immutable; from any thread.
class TallixFacility {
 public:
  /// A single channel whose pattern is wrong is logged and left out.
  explicit TallixFacility(const Configuration::Tallix& configuration);

  /// As `TallixCopyChannelsInGroup`.
  [[nodiscard]] TallixChannels channelsInGroup(std::optional<std::string_view> group,
                                               std::optional<std::string_view> subgroup,
                                               std::optional<Error>& error) const;

 private:
  std::filesystem::path root_;
  std::vector<DriverChannel> single_;
};

}  // namespace quarvel
