#pragma once

#include <cstdint>
#include <string>
#include <utility>
#include <vector>

#include "base/Error.h"
#include "base/Mutex.h"
#include "device/CounterFile.h"
#include "device/TallixFacility.h"
#include "platform/Tallix.h"

namespace quarvel {

/// A channel with its value. Valid during the visit that it is handed to.
class TallixChannelSample {
 public:
  const DriverChannel& channel;
  std::int64_t value;
};

/// The values of a subscription at one time. Immutable; any thread.
class TallixSampleSet {
 public:
  /// `list` has one value for each channel of `set`.
  TallixSampleSet(TallixChannels set, std::vector<std::int64_t> list)
      : channels(std::move(set)), values(std::move(list)) {}
  const TallixChannels channels;           // samples of the same set alone can be compared
  const std::vector<std::int64_t> values;  // one for each channel, in their order
};

/// Channels with their files held open. Shared by its users; closes the files with the last
/// reference. Any thread; one samples at a time.
class TallixSubscription {
 public:
  /// Opens the files of `channels`. A channel whose file cannot be opened is logged and left out.
  explicit TallixSubscription(const TallixChannelSet& channels);

  /// The channels with open files.
  [[nodiscard]] const TallixChannels& channels() const { return subscribed_; }
  /// Waits while another thread samples. Reads every file once, also when it holds many channels.
  /// Errors: as `TallixCreateSamples`.
  [[nodiscard]] Result<TallixSamples> sample();

 private:
  /// An open file and its channels.
  struct Source {
    CounterFile file;                   // read once a sample
    std::vector<std::size_t> channels;  // indices in `subscribed_`
  };

  TallixChannels subscribed_;  // constant after construction
  Mutex mutex_;                // held while the files are read
  std::vector<Source> sources_ QUARVEL_GUARDED_BY(mutex_);
  // The content of the file that is read, kept to save allocations.
  std::string buffer_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
