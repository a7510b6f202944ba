#pragma once

#include <filesystem>
#include <string>

#include "base/Error.h"
#include "tools/Commands.h"

namespace quarvel::commands {

/// The service's runtime directory: that of its socket, unless only the socket is elsewhere.
[[nodiscard]] std::filesystem::path RuntimeDirectory(const Options& options);

/// Whether a service takes connections.
[[nodiscard]] bool ServiceIsUp(const Options& options);

/// What the service says of itself, JSON text, which it is asked for. Fails when none answers.
[[nodiscard]] Result<std::string> StatusText(const Options& options);

/// Posts a notification and returns the file that it was posted by. Fails when no service is there
/// that takes one.
[[nodiscard]] Result<std::filesystem::path> Post(const Options& options, const std::string& name);

}  // namespace quarvel::commands
