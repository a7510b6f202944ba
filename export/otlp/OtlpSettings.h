#pragma once

#include <chrono>
#include <map>
#include <memory>
#include <string>

#include "export/ExportSettings.h"
#include "system/Configuration.h"

namespace quarvel {

/// [agent.otlp]. Constant once read; shared by the configuration and the engine.
struct OtlpSettings : BackendSettings {
  std::string endpoint = "http://localhost:4318";
  std::map<std::string, std::string> headers;
  bool gzip = true;
  TlsSettings tls;
  std::chrono::seconds connect{5};
  std::chrono::seconds timeout{10};  // of a whole request
};

/// Reads and checks the section, without the engine and its library.
[[nodiscard]] std::shared_ptr<const BackendSettings> ReadOtlpSettings(
    ConfigurationSection& section);

}  // namespace quarvel
