#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "base/Error.h"

namespace quarvel {

/// The driver statistics facility.
struct SimulatedTallix {
  using Name = std::optional<std::string>;
  struct Channel {
    Name group;
    Name subgroup;
    Name name;
    std::int64_t value = 0;
    bool published = true;  // else its group is known all the same
  };
  /// What is published now. Channels may change their values but not vanish.
  std::vector<Channel> channels;

  // Switches.
  std::optional<Error> channelsError;  // the channels are returned all the same
  std::optional<Error> samplesError;
};

}  // namespace quarvel
