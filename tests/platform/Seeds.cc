#include "tests/platform/Seeds.h"

#include <gtest/gtest.h>

#include <cstdlib>

namespace quarvel {

bool SeedRange::Iterator::operator==(std::default_sentinel_t) const {
  return left_ == 0 || testing::Test::HasFailure();
}

SeedRange Seeds() {
  constexpr std::size_t kByDefault = 20;
  if (const char* one = std::getenv("QUARVEL_SEED")) return {std::strtoull(one, nullptr, 10), 1};
  constexpr std::size_t kByNight = 25;
  const char* count = std::getenv("QUARVEL_SEEDS");
  if (count == nullptr) return {1, kByDefault};
  const std::size_t times = std::getenv("QUARVEL_NIGHTLY") == nullptr ? 1 : kByNight;
  return {1, std::strtoul(count, nullptr, 10) * times};
}

}  // namespace quarvel
