#pragma once

#include <memory>
#include <string>

#include "export/ExportDevice.h"
#include "export/ExportEngine.h"
#include "system/Configuration.h"

namespace quarvel {

/// The function that an engine's module exports under `kEngineModuleEntry`. `settings` are of the
/// engine's own type: its own reader made them.
using MakeEngine = ExportEngine* (*)(const BackendSettings& settings, const ExportDevice& device);
inline constexpr const char* kEngineModuleEntry = "QuarvelMakeEngine";

/// Makes the engine of a backend from its module, `export-<backend>.so`, which is loaded now and
/// never closed. An engine's libraries are larger than all the rest of the service, and most
/// devices need one engine or none. When the module cannot be loaded, the result is an engine that
/// takes nothing and gives the reason. Blocks while the module is loaded.
[[nodiscard]] std::unique_ptr<ExportEngine> LoadEngine(const std::string& backend,
                                                       const BackendSettings& settings,
                                                       const ExportDevice& device);

}  // namespace quarvel
