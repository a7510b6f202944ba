#pragma once

#include <gtest/gtest.h>

#include <cstdint>
#include <ranges>

namespace quarvel {

/// `QUARVEL_SEED` alone when it is set, to replay a failure; else as many as `QUARVEL_SEEDS` says
/// (by night, when `QUARVEL_NIGHTLY` is set, 25 times as many), 20 by default.
[[nodiscard]] std::ranges::iota_view<std::uint64_t, std::uint64_t> AllSeeds();

/// The seeds to run a test's body for. Ends early once the test has failed: the first seed that
/// fails is enough.
[[nodiscard]] inline auto Seeds() {
  return AllSeeds() |
         std::views::take_while([](std::uint64_t) { return !testing::Test::HasFailure(); });
}

}  // namespace quarvel

/// A test whose body is a member function of a simulation that is made anew for each seed.
#define SEEDED_TEST(suite, name, Simulated)                      \
  struct suite##_##name final : Simulated {                      \
    using Simulated::Simulated;                                  \
    void body();                                                 \
  };                                                             \
  TEST(suite, name) {                                            \
    for (const auto seed : Seeds()) suite##_##name(seed).body(); \
  }                                                              \
  void suite##_##name::body()
