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
  /// The collector's address, with or without the path /v1/logs.
  std::string endpoint = "http://localhost:4318";
  /// Sent with each request besides the protocol's own. May hold secrets.
  std::map<std::string, std::string> headers;
  bool gzip = true;  // requests are compressed
  TlsSettings tls;
  std::chrono::seconds connect{5};   // of one connection attempt
  std::chrono::seconds timeout{10};  // of a whole request
};

/// Reads and checks the section, without the engine and its library. Errors go to `section`. Never
/// null.
[[nodiscard]] std::shared_ptr<const BackendSettings> ReadOtlpSettings(
    ConfigurationSection& section);

}  // namespace quarvel
