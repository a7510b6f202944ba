#pragma once

#include <chrono>
#include <filesystem>
#include <string>

#include "base/Error.h"
#include "tools/Commands.h"

// The files in the service's runtime directory, by which a tool and the service talk beside the
// socket: notifications, the status, answers. One thread.

namespace quarvel::commands {

/// The service's runtime directory: that of its socket, unless only the socket is elsewhere.
[[nodiscard]] std::filesystem::path RuntimeDirectory(const Options& options);

/// Whether a service takes connections.
[[nodiscard]] bool ServiceIsUp(const Options& options);

/// Has the service write its status; returns the JSON text. Fails when no service answers.
[[nodiscard]] Result<std::string> StatusText(const Options& options);

/// A failure of the status: domain "quarvel.status".
[[nodiscard]] Error StatusError(std::string reason);

/// Posts a notification and returns the file by which it was posted. Fails when no running service
/// takes notifications.
[[nodiscard]] Result<std::filesystem::path> Post(const Options& options, const std::string& name);

/// Watches a directory for files that are moved into it, from construction on. Make it before
/// asking for the file, so that none is missed.
class FileArrival {
 public:
  explicit FileArrival(const std::filesystem::path& directory);
  ~FileArrival();
  FileArrival(const FileArrival&) = delete;
  FileArrival& operator=(const FileArrival&) = delete;

  /// False when the directory cannot be watched; `errno` then has the reason.
  [[nodiscard]] bool watching() const { return watching_; }

  /// Waits for `name`. False when it has not arrived within `timeout`.
  [[nodiscard]] bool wait(const char* name, std::chrono::milliseconds timeout) const;

 private:
  /// Takes the events that have come so far.
  [[nodiscard]] bool hasArrived(const char* name) const;

  const int descriptor_;  // of inotify, or -1
  const bool watching_;
};

}  // namespace quarvel::commands
