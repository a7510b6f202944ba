#pragma once

#include <sys/types.h>

#include <cstddef>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

#include "base/Error.h"

namespace quarvel {

// Files and directories: whole-file reads, atomic writes. May be called from any thread; each
// operation waits for the medium.

/// The domain of errors below. The code is the system's error number, the reason names the path.
inline constexpr const char* kFileErrorDomain = "quarvel.files";

/// Permissions of the service's own files and directories: the group may read.
inline constexpr mode_t kPrivateFile = 0640;       // the owner writes
inline constexpr mode_t kPrivateDirectory = 0750;  // the group may list

/// Larger than any file that is read whole; keeps a wrong path (a device, say) from taking all
/// memory.
inline constexpr std::size_t kLargestWholeFile = 16'777'216;

/// Reads a whole file. Never waits for a writer: a FIFO without one is empty.
/// Errors: ENOENT or ENOTDIR when there is no such file, EFBIG when it has more than
/// `maximumBytes`.
[[nodiscard]] Result<std::string> ReadWholeFile(const std::filesystem::path& path,
                                                std::size_t maximumBytes = kLargestWholeFile);

/// Writes a whole file in one step: a reader, even after a power cut, sees the old content or the
/// new one, never a part. The directory must exist. The file gets exactly `permissions`; without
/// them a new file may be read by everyone, as far as the process's mask allows.
[[nodiscard]] Outcome ReplaceFile(std::string_view path, std::string_view content,
                                  std::optional<mode_t> permissions = std::nullopt);

/// Replaces a file that a person may have made: its permissions stay, for root its owner too, and a
/// link keeps pointing to the file that is replaced. A new file gets `permissions`.
[[nodiscard]] Outcome RewriteFile(const std::filesystem::path& path, std::string_view content,
                                  mode_t permissions);

/// Makes a directory and the missing ones above it. `path` itself, when it is made, gets exactly
/// `permissions`; those above get them as far as the process's mask allows. An existing directory
/// is left as it is.
[[nodiscard]] Outcome MakeDirectory(std::string_view path, mode_t permissions);

/// Makes one of the service's own directories and the missing ones above it: all of them
/// `kPrivateDirectory`, and durable when this returns. An existing directory is left as it is.
/// Returns 0 or the system's error number.
[[nodiscard]] int CreatePrivateDirectory(const std::filesystem::path& directory);

/// Makes the names in a directory durable: files that were created, renamed or removed in it stay
/// so after a power cut. Returns 0 or the system's error number.
int SyncDirectory(const std::filesystem::path& directory);

}  // namespace quarvel
