#pragma once

#include <array>
#include <cstdint>
#include <string>
#include <vector>

#include "base/Payload.h"
#include "platform/Counters.h"

namespace quarvel {

/// The analytics facility.
struct SimulatedVistrel {
  struct Event {
    std::string name;
    Payload payload;
  };
  std::vector<Event> events;
};

/// The power log.
struct SimulatedOhmrik {
  std::vector<Payload> records;
};

/// What the service has counted. Its messages are conserved: once nothing is on its way, accepted =
/// handed to the agent (taken or refused) + dropped.
struct SimulatedCounters {
  std::uint64_t accepted = 0;
  std::array<std::uint64_t, 3> dropped{};
  std::array<std::int64_t, 3> gauges{};

  [[nodiscard]] std::uint64_t of(StoreDrop reason) const {
    return dropped[static_cast<std::size_t>(reason)];
  }
};

}  // namespace quarvel
