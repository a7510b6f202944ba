#pragma once

#include <chrono>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "export/ExportSettings.h"
#include "system/Configuration.h"

namespace quarvel {

/// [agent.nats]. Constant once read; shared by the configuration and the engine.
struct NatsSettings : BackendSettings {
  std::vector<std::string> urls{"nats://localhost:4222"};  // tried in turn
  std::string stream = "QUARVEL";             // empty: any stream that has the subject, unchecked
  bool createStream = false;                  // with the next two
  int replicas = 3;                           // of a stream that is created; 1 to 5
  std::chrono::seconds duplicateWindow{120};  // in which the stream drops repeats by their names
  std::filesystem::path credentials;          // a file of user and key; empty: none
  TlsSettings tls;
  std::chrono::seconds acknowledge{10};  // time limit of acknowledgements
};

/// Reads and checks the section, without the engine and its library. Errors go to `section`. Never
/// null.
[[nodiscard]] std::shared_ptr<const BackendSettings> ReadNatsSettings(
    ConfigurationSection& section);

}  // namespace quarvel
