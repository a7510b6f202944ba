#pragma once

#include <memory>
#include <string>

#include "export/ExportDevice.h"
#include "export/ExportEngine.h"
#include "system/Configuration.h"

namespace quarvel {

/// What an engine's module exports, under `kEngineModuleEntry`.
using MakeEngine = ExportEngine* (*)(const Configuration::Agent& agent, const ExportDevice& device);
inline constexpr const char* kEngineModuleEntry = "QuarvelMakeEngine";

/// Makes the engine of a backend. Its code is in a module of its own (`export-<backend>.so`),
/// loaded now: what an engine stands on is larger than all the rest of the service, and slower to
/// load, and most devices have none or one. When the module cannot be loaded the engine is one that
/// takes nothing and says why.
[[nodiscard]] std::unique_ptr<ExportEngine> LoadEngine(const std::string& backend,
                                                       const Configuration::Agent& agent,
                                                       const ExportDevice& device);

}  // namespace quarvel
