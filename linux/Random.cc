#include "platform/Random.h"

#include <sys/random.h>

#include <chrono>

namespace quarvel {
namespace {

std::uint64_t seed() {
  std::uint64_t seed = 0;
  if (getrandom(&seed, sizeof seed, GRND_NONBLOCK) == sizeof seed) return seed;
  // Too early after boot: spreading devices apart in time needs no more than this.
  static thread_local const char here = 0;
  const auto now = std::chrono::system_clock::now().time_since_epoch().count();
  return static_cast<std::uint64_t>(now) ^ reinterpret_cast<std::uintptr_t>(&here);
}

/// SplitMix64 (Steele, Lea, Flood: Fast splittable pseudorandom number generators), the upper half.
std::uint32_t next() {
  thread_local std::uint64_t state = seed();
  std::uint64_t mixed = state += 0x9e3779b97f4a7c15;
  mixed = (mixed ^ (mixed >> 30)) * 0xbf58476d1ce4e5b9;
  mixed = (mixed ^ (mixed >> 27)) * 0x94d049bb133111eb;
  return static_cast<std::uint32_t>((mixed ^ (mixed >> 31)) >> 32);
}

}  // namespace

// The upper half of a product spreads 2^32 numbers over `bound`; the first 2^32 mod `bound` of each
// share are thrown away, so that all shares are equal (Lemire: Fast random integer generation in an
// interval).
std::uint32_t RandomBelow(std::uint32_t bound) {
  const std::uint32_t surplus = -bound % bound;
  std::uint64_t product = 0;
  do {
    product = std::uint64_t{next()} * bound;
  } while (static_cast<std::uint32_t>(product) < surplus);
  return static_cast<std::uint32_t>(product >> 32);
}

}  // namespace quarvel
