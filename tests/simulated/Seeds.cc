#include "tests/simulated/Seeds.h"

#include <cstdlib>

namespace quarvel {

Seeds::Seeds() {
  constexpr std::uint64_t kByNight = 25;
  if (const char* one = std::getenv("QUARVEL_SEED")) {
    first_ = last_ = std::strtoull(one, nullptr, 10);
  } else if (const char* count = std::getenv("QUARVEL_SEEDS")) {
    const std::uint64_t times = std::getenv("QUARVEL_NIGHTLY") == nullptr ? 1 : kByNight;
    last_ = std::strtoull(count, nullptr, 10) * times;
  }
}

}  // namespace quarvel
