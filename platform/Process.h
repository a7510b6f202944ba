#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace quarvel {

[[nodiscard]] std::int32_t OwnProcessIdentifier();
[[nodiscard]] std::string OwnProcessName();

/// The short command name (at most 16 characters) of a process, `processIdentifier` at least 1;
/// none when there is no such process or it may not be looked at. Reads the kernel's process table:
/// short.
[[nodiscard]] std::optional<std::string> ProcessCommandName(std::int32_t processIdentifier);

/// Ends the process at once. No destructor runs and no queue is drained; what the telemetry agent
/// has accepted is made safe first.
[[noreturn]] void ExitProcess(int status);

}  // namespace quarvel
