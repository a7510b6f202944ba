#include "tests/platform/Seeds.h"

#include <cstdlib>
#include <numeric>

namespace quarvel {

std::vector<std::uint64_t> Seeds() {
  if (const char* one = std::getenv("QUARVEL_SEED")) return {std::strtoull(one, nullptr, 10)};
  const char* count = std::getenv("QUARVEL_SEEDS");
  std::vector<std::uint64_t> seeds(count != nullptr ? std::strtoul(count, nullptr, 10) : 20);
  std::iota(seeds.begin(), seeds.end(), 1U);
  return seeds;
}

}  // namespace quarvel
