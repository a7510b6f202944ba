#pragma once

#include <span>

#include "export/Exporters.h"
#include "system/Configuration.h"

namespace quarvel {

/// The engines that the service knows, for its configuration. Constant.
[[nodiscard]] std::span<const BackendKind> RemoteBackends();

/// The process's exporters, one for each remote backend that is configured; started on first use,
/// which the service makes once its store is open. They follow `[agent] export`, which is read
/// again with the preferences, and end before the store is closed. Never destroyed.
[[nodiscard]] Exporters& ProcessExporters();

}  // namespace quarvel
