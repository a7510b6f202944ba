#pragma once

#include <cstdint>
#include <vector>

namespace quarvel {

/// The seeds to run a test body for: `QUARVEL_SEED` alone when it is set, to replay a failure; else
/// as many as `QUARVEL_SEEDS` says, 20 by default.
[[nodiscard]] std::vector<std::uint64_t> Seeds();

}  // namespace quarvel
