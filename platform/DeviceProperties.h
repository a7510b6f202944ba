#pragma once

#include <cstdint>
#include <optional>
#include <string_view>

namespace quarvel {

// Properties of the device, constant for the life of the process. None when the device does not
// have the property, or has it as another kind. From any thread; never block.

/// A boolean property, such as "InternalBuild".
[[nodiscard]] std::optional<bool> DevicePropertyBoolean(std::string_view name);
/// An integer property, such as "DeviceClassNumber".
[[nodiscard]] std::optional<std::int64_t> DevicePropertyInteger(std::string_view name);

}  // namespace quarvel
