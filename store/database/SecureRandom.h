#pragma once

#include <optional>
#include <string>

namespace quarvel {

// May wait for the kernel's random numbers early in the life of the device, never later.

/// 128 unpredictable bits as 32 hexadecimal digits; behind the parent's token and a full stop when
/// there is one.
[[nodiscard]] std::string NewHierarchyToken(const std::optional<std::string>& parent);

/// A random UUID (RFC 9562, version 4), in lower case.
[[nodiscard]] std::string NewUuid();

}  // namespace quarvel
