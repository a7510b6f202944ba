#pragma once

#include <memory>

#include "base/Error.h"
#include "platform/linux/store/TelemetryStore.h"

namespace quarvel {

/// Opens the process's telemetry store, as configured; the service does so before it listens. Later
/// calls repeat the answer of the first. Errors: as `TelemetryStore::open`.
[[nodiscard]] Outcome OpenProcessTelemetryStore();

/// The process's telemetry store, opened when it was not yet; when it cannot be, an error line says
/// why and the process ends with status 1. Closed by `ExitProcess`, with everything that it has
/// taken made safe; never destroyed.
[[nodiscard]] const std::shared_ptr<TelemetryStore>& ProcessTelemetryStore();

}  // namespace quarvel
