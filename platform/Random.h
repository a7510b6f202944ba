#pragma once

#include <cstdint>

namespace quarvel {

/// A uniformly random number from 0 to `bound` - 1; `bound` is at least 1. From any thread; never
/// blocks.
[[nodiscard]] std::uint32_t RandomBelow(std::uint32_t bound);

}  // namespace quarvel
