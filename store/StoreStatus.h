#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <memory>

#include "store/TelemetryStore.h"
#include "system/Status.h"

namespace quarvel {

/// The process's gauges, in the order of `Gauge`. Any thread.
using Gauges = std::array<std::atomic<std::int64_t>, 3>;
[[nodiscard]] Gauges& ProcessGauges();

/// Adds the store, its queue and its counters, and the process's gauges, to the status. The status
/// keeps `store` and reads it on the thread that writes the status.
void DescribeInStatus(Status& status, const std::shared_ptr<const TelemetryStore>& store);

}  // namespace quarvel
