#pragma once

#include <filesystem>

namespace quarvel {

/// Where the service keeps its files: systemd's directory variables first, then the fall-backs for
/// a run by hand.
struct StandardPaths {
  std::filesystem::path runtime;
  std::filesystem::path state;
  std::filesystem::path configuration;
  /// The listening socket: `$QUARVEL_SOCKET`, or reporting.sock in `runtime`.
  std::filesystem::path socket;
  /// Prefix of the diagnostics directory: `$QUARVEL_DIAGNOSTICS_PREFIX`, empty by default.
  std::filesystem::path diagnosticsPrefix;

  /// Reads the environment; `root` chooses the fall-backs.
  [[nodiscard]] static StandardPaths fromEnvironment(bool root);
};

}  // namespace quarvel
