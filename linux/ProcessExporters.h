#pragma once

#include "export/Exporters.h"

namespace quarvel {

/// The process's exporters, one for each remote backend that is configured; started on first use,
/// which the service makes once its store is open. They follow `[agent] export`, which is read
/// again with the preferences, and end before the store is closed. Never destroyed.
[[nodiscard]] Exporters& ProcessExporters();

}  // namespace quarvel
