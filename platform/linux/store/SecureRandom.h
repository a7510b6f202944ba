#pragma once

#include <string>

namespace quarvel {

/// 128 random bits that nobody can guess, as 32 hexadecimal digits. May wait for the kernel's
/// random numbers early in the life of the device, never later.
[[nodiscard]] std::string NewSecureToken();

/// A random UUID (RFC 9562, version 4), in lower case.
[[nodiscard]] std::string NewUuid();

}  // namespace quarvel
