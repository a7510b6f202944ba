#pragma once

#include <cstdint>
#include <filesystem>
#include <string_view>
#include <vector>

namespace quarvel {

/// The directories of the service, as systemd's variables name them, with fall-backs for a run by
/// hand. The service, the client library and the tools all read them here.
/// A value: read it once and keep it. Reading takes the environment, which nothing may change
/// meanwhile.
struct StandardPaths {
  std::filesystem::path runtime;        // sockets, status and notifications; gone after a reboot
  std::filesystem::path state;          // the store
  std::filesystem::path configuration;  // quarvel.toml and preferences/
  /// The listening socket: `$QUARVEL_SOCKET`, or reporting.sock in `runtime`.
  std::filesystem::path socket;
  /// Prefix of the diagnostics directory: `$QUARVEL_DIAGNOSTICS_PREFIX`, empty by default.
  std::filesystem::path diagnosticsPrefix;

  /// The directories that a service started with this environment uses. `root` chooses the
  /// fall-backs; without it the process's effective user decides.
  [[nodiscard]] static StandardPaths fromEnvironment(bool root);
  [[nodiscard]] static StandardPaths fromEnvironment();

  /// One of the three directories.
  enum class Kind : std::uint8_t { runtime, state, configuration };

  /// The directories where a service's files may be, in the order in which a client or tool looks:
  /// the first that systemd names for this process, this user's own (not for root), the installed
  /// service's. A relative variable is ignored. The first is the one that `fromEnvironment` takes.
  [[nodiscard]] static std::vector<std::filesystem::path> candidates(Kind kind, bool root);

  /// `file` in the first of the directories that holds it. When none does: in the installed
  /// service's directory if this user may not look there, so that opening it tells the reason; else
  /// in the first.
  [[nodiscard]] static std::filesystem::path find(Kind kind, std::string_view file);
};

}  // namespace quarvel
