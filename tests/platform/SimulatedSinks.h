#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "base/Payload.h"
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

}  // namespace quarvel
