#pragma once

#include <array>
#include <cstdint>

#include "platform/Counters.h"

namespace quarvel {

/// What the service has counted. Its messages are conserved: once nothing is on its way, accepted =
/// handed to the agent (taken or refused) + dropped.
struct SimulatedCounters {
  std::uint64_t accepted = 0;
  std::array<std::uint64_t, 3> dropped{};
  std::array<std::int64_t, 3> gauges{};

  [[nodiscard]] std::uint64_t of(MessageDrop reason) const {
    return dropped[static_cast<std::size_t>(reason)];
  }
  [[nodiscard]] std::int64_t of(Gauge gauge) const {
    return gauges[static_cast<std::size_t>(gauge)];
  }
};

}  // namespace quarvel
