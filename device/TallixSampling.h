#pragma once

#include <cstdint>
#include <string>
#include <utility>
#include <vector>

#include "base/Error.h"
#include "base/Mutex.h"
#include "device/CounterFile.h"
#include "device/TallixChannels.h"
#include "platform/Tallix.h"

namespace quarvel {

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

}  // namespace quarvel
