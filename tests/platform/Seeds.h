#pragma once

#include <cstddef>
#include <cstdint>
#include <iterator>

namespace quarvel {

/// The seeds to run a test's body for, to be used in a range-for. Ends early once the test has
/// failed: the first seed that fails is enough.
class SeedRange {
 public:
  class Iterator {
   public:
    Iterator(std::uint64_t seed, std::size_t left) : seed_(seed), left_(left) {}
    std::uint64_t operator*() const { return seed_; }
    Iterator& operator++() {
      ++seed_;
      --left_;
      return *this;
    }
    bool operator==(std::default_sentinel_t) const;

   private:
    std::uint64_t seed_;
    std::size_t left_;
  };

  SeedRange(std::uint64_t first, std::size_t count) : first_(first), count_(count) {}
  [[nodiscard]] Iterator begin() const { return {first_, count_}; }
  [[nodiscard]] std::default_sentinel_t end() const { return {}; }
  [[nodiscard]] std::size_t size() const { return count_; }

 private:
  std::uint64_t first_;
  std::size_t count_;
};

/// `QUARVEL_SEED` alone when it is set, to replay a failure; else as many as `QUARVEL_SEEDS` says
/// (by night, when `QUARVEL_NIGHTLY` is set, 25 times as many), 20 by default.
[[nodiscard]] SeedRange Seeds();

}  // namespace quarvel
