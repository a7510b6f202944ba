#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <memory>

#include "store/TelemetryStore.h"
#include "system/Status.h"

namespace quarvel {

/// The service's present numbers, in the order of `Gauge`. Written by any thread; the status reads
/// each by itself, so that together they may not be of one moment.
using Gauges = std::array<std::atomic<std::int64_t>, 3>;

/// Adds the store, its queue and its counters, and the service's gauges, to the status. The status
/// keeps `store` and reads it on the thread that writes the status; `gauges` outlives it.
void DescribeInStatus(Status& status, const std::shared_ptr<const TelemetryStore>& store,
                      const Gauges& gauges);

}  // namespace quarvel
