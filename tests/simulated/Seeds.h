#pragma once

#include <gtest/gtest.h>

#include <cstdint>
#include <iterator>

namespace quarvel {

/// The seeds to run a test's body for, to be used in a range-for. Ends early once the test has
/// failed: the first seed that fails is enough.
class Seeds {
 public:
  /// `QUARVEL_SEED` alone when it is set, to replay a failure; else as many as `QUARVEL_SEEDS` says
  /// (by night, when `QUARVEL_NIGHTLY` is set, 25 times as many), 20 by default.
  Seeds();

  struct Iterator {
    std::uint64_t seed;
    std::uint64_t last;
    std::uint64_t operator*() const { return seed; }
    void operator++() { ++seed; }
    bool operator!=(std::default_sentinel_t) const {
      return seed <= last && !testing::Test::HasFailure();
    }
  };
  [[nodiscard]] Iterator begin() const { return {first_, last_}; }
  [[nodiscard]] std::default_sentinel_t end() const { return {}; }
  [[nodiscard]] std::uint64_t size() const { return last_ - first_ + 1; }

 private:
  std::uint64_t first_ = 1;
  std::uint64_t last_ = 20;
};

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
