#pragma once

#include <sys/types.h>

#include <filesystem>
#include <string_view>

#include "base/Error.h"

namespace quarvel {

/// What the service's own files and directories are to others: the group may read.
inline constexpr mode_t kPrivateFile = 0640;
inline constexpr mode_t kPrivateDirectory = 0750;

/// As the operation of that name in `platform/FileSystem.h`, but the file gets exactly
/// `permissions`.
[[nodiscard]] Outcome WriteFileAtomically(std::string_view path, std::string_view content,
                                          mode_t permissions);

/// Makes one of the service's own directories, with those above it that are missing: all of them
/// `kPrivateDirectory`, and on the medium when this returns. One that exists is left as it is.
/// Returns 0 or the system's error number.
[[nodiscard]] int CreatePrivateDirectory(const std::filesystem::path& directory);

/// Makes the names in a directory safe from a power cut. Returns 0 or the system's error number.
int SyncDirectory(const std::filesystem::path& directory);

}  // namespace quarvel
