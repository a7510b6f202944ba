#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "base/Error.h"

namespace quarvel {

// Files of the service. From any thread; the operations that write block until the medium has
// answered. Errors: domain `kFileErrorDomain` (`base/Files.h`), the code is the system's error
// number, the reason names the path.

/// The path on this device of the diagnostics directory that the system calls `path`.
[[nodiscard]] std::string DiagnosticsPath(std::string_view path);

/// Creates a directory and its missing parents. A new `path` gets exactly `permissions`; for new
/// parents the process's mask is applied to them. An existing directory is left as it is.
[[nodiscard]] Outcome CreateDirectory(std::string_view path, std::uint32_t permissions);

/// Replaces a whole file atomically: a reader sees the old content or the new one, never a part,
/// even after a power cut. The directory must exist. All users may read a new file, as far as the
/// process's mask allows.
[[nodiscard]] Outcome WriteFileAtomically(std::string_view path, std::string_view content);

}  // namespace quarvel
