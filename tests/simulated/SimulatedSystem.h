#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <random>
#include <string>
#include <vector>

#include "base/Error.h"
#include "platform/Orientation.h"

namespace quarvel {

/// Where `RandomBelow` gets its numbers: from the seed.
class SimulatedRandom {
 public:
  explicit SimulatedRandom(std::uint64_t seed) : random_(seed) {}

  /// Switch: the largest number is drawn from now on.
  bool largest = false;

  std::uint32_t below(std::uint32_t bound);

 private:
  std::mt19937 random_;
};

/// The orientation facility. Changes are told on a platform thread; handlers must not wait there.
class SimulatedOrientation {
 public:
  using Handlers = std::map<std::string, OrientationHandler, std::less<>>;
  Handlers device;
  Handlers ui;

  /// Tells `device` or `ui`.
  static void turn(const Handlers& handlers, Orientation orientation);
};

struct SimulatedFiles {
  /// Path and content of every write in order, also of those that failed.
  std::vector<std::pair<std::string, std::string>> writes;

  // Switches.
  std::optional<Error> directoryError;
  std::optional<Error> writeError;
};

}  // namespace quarvel
