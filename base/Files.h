#pragma once

#include <sys/types.h>

#include <filesystem>
#include <optional>
#include <string_view>

#include "base/Error.h"

namespace quarvel {

// Files and directories. Any thread; each operation waits for the medium.

/// The domain of errors below. The code is the system's error number, the reason names the path.
inline constexpr const char* kFileErrorDomain = "quarvel.files";

/// Permissions of the service's own files and directories: the group may read.
inline constexpr mode_t kPrivateFile = 0640;
inline constexpr mode_t kPrivateDirectory = 0750;

/// Writes a whole file in one step: a reader, even after a power cut, sees the old content or the
/// new one, never a part. The directory must exist. The file gets exactly `permissions`; without
/// them a new file may be read by everyone, as far as the process's mask allows.
[[nodiscard]] Outcome ReplaceFile(std::string_view path, std::string_view content,
                                  std::optional<mode_t> permissions = std::nullopt);

/// Makes a directory and the missing ones above it. `path` itself, when it is made, gets exactly
/// `permissions`; those above get what the process's mask leaves of them. An existing directory is
/// left as it is.
[[nodiscard]] Outcome MakeDirectory(std::string_view path, mode_t permissions);

/// Makes one of the service's own directories and the missing ones above it: all of them
/// `kPrivateDirectory`, and on the medium when this returns. An existing directory is left as it
/// is. Returns 0 or the system's error number.
[[nodiscard]] int CreatePrivateDirectory(const std::filesystem::path& directory);

/// Makes the names in a directory safe from a power cut. Returns 0 or the system's error number.
int SyncDirectory(const std::filesystem::path& directory);

}  // namespace quarvel
