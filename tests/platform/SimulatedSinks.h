#pragma once

#include <array>
#include <cstdint>
#include <string>
#include <vector>

#include "base/Payload.h"
#include "platform/Counters.h"
#include "tests/platform/Scheduler.h"

namespace quarvel {

/// The analytics facility.
struct SimulatedVistrel {
  struct Event {
    std::string name;
    Payload payload;
    Scheduler::Duration at;
  };
  /// Switch: whether events are wanted. An unwanted one does not have its payload built.
  bool wanted = true;
  std::vector<Event> events;
};

/// The power log.
struct SimulatedOhmrik {
  struct Record {
    std::int32_t domain;
    std::string name;
    Payload payload;
    Scheduler::Duration at;
  };
  std::vector<Record> records;
};

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
