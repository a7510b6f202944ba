#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "base/Error.h"

namespace quarvel {

// Files of the service. From any thread; these operations wait for the medium.
// Errors: domain `kFileErrorDomain` (`base/Files.h`), the code is the system's error number, the
// reason names the path.

/// Where the diagnostics directory that the system calls `path` lies on this device.
[[nodiscard]] std::string DiagnosticsPath(std::string_view path);

/// Makes a directory and those above it that are missing. `path` itself, when it is made, gets
/// exactly `permissions`; those above get what the process's mask leaves of them. A directory that
/// exists is left as it is.
[[nodiscard]] Outcome CreateDirectory(std::string_view path, std::uint32_t permissions);

/// Writes a whole file in one step: whoever opens it, even after a power cut, sees the old content
/// or the new one, never a part. The directory must exist. A new file may be read by everybody, as
/// far as the process's mask allows.
[[nodiscard]] Outcome WriteFileAtomically(std::string_view path, std::string_view content);

}  // namespace quarvel
