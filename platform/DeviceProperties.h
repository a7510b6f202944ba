#pragma once

#include <cstdint>
#include <optional>
#include <string_view>

namespace quarvel {

// What the device says of itself. Constant for the life of the process; none for a property that
// the device does not have, or has as another kind.

[[nodiscard]] std::optional<bool> DevicePropertyBoolean(std::string_view name);
[[nodiscard]] std::optional<std::int64_t> DevicePropertyInteger(std::string_view name);

}  // namespace quarvel
