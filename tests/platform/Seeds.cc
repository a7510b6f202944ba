#include "tests/platform/Seeds.h"

#include <cstdlib>

namespace quarvel {

std::ranges::iota_view<std::uint64_t, std::uint64_t> AllSeeds() {
  constexpr std::uint64_t kByDefault = 20;
  constexpr std::uint64_t kByNight = 25;
  if (const char* one = std::getenv("QUARVEL_SEED")) {
    const std::uint64_t seed = std::strtoull(one, nullptr, 10);
    return {seed, seed + 1};
  }
  const char* count = std::getenv("QUARVEL_SEEDS");
  if (count == nullptr) return {1, 1 + kByDefault};
  const std::uint64_t times = std::getenv("QUARVEL_NIGHTLY") == nullptr ? 1 : kByNight;
  return {1, 1 + std::strtoull(count, nullptr, 10) * times};
}

}  // namespace quarvel
