#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <memory>

#include "store/TelemetryStore.h"
#include "system/Status.h"

namespace quarvel {

/// What the process has now, in the order of `Gauge`.
using Gauges = std::array<std::atomic<std::int64_t>, 3>;
[[nodiscard]] Gauges& ProcessGauges();

/// Has the status tell of the store, its queue and its counters, and of the process's gauges.
void DescribeInStatus(Status& status, const std::shared_ptr<const TelemetryStore>& store);

}  // namespace quarvel
