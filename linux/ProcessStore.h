#pragma once

#include <memory>

#include "store/EventSinks.h"
#include "store/TelemetryStore.h"

namespace quarvel {

/// The process's telemetry store, as configured; opened on first use, which the service makes
/// before it listens. When it cannot be opened, an error line says why and the process ends with
/// status 1. Closed by `ExitProcess`, with everything that it has taken made safe; never destroyed.
[[nodiscard]] const std::shared_ptr<TelemetryStore>& ProcessTelemetryStore();

/// The way of events to it; never destroyed.
[[nodiscard]] EventQueue& ProcessEventQueue();

}  // namespace quarvel
