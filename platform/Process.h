#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace quarvel {

/// This process. From any thread, like the operations below.
[[nodiscard]] std::int32_t OwnProcessIdentifier();
[[nodiscard]] std::string OwnProcessName();

/// The short command name (at most 16 characters) of a process, `processIdentifier` at least 1.
/// None when there is no such process or it may not be inspected. Reads the kernel's process table,
/// which takes microseconds.
[[nodiscard]] std::optional<std::string> ProcessCommandName(std::int32_t processIdentifier);

/// Ends the process at once. No destructor runs and no queue is drained, but rows that the
/// telemetry agent has accepted are committed first.
[[noreturn]] void ExitProcess(int status);

}  // namespace quarvel
