#pragma once

#include <array>
#include <cstdint>
#include <map>
#include <optional>
#include <random>
#include <string>
#include <vector>

#include "base/Error.h"
#include "platform/Orientation.h"

namespace quarvel {

struct TraceEvent {
  std::uint32_t code;
  std::array<std::uint64_t, 4> arguments;
};

/// Where `RandomBelow` gets its numbers: from the seed, or as the test says.
class SimulatedRandom {
 public:
  explicit SimulatedRandom(std::uint64_t seed) : random_(seed) {}

  /// Switch: the number that is drawn from now on.
  std::optional<std::uint32_t> always;
  /// The bounds that were asked for.
  std::vector<std::uint32_t> bounds;

  std::uint32_t below(std::uint32_t bound);

 private:
  std::mt19937 random_;
};

struct SimulatedProcess {
  std::int32_t ownIdentifier = 4711;
  std::string ownName = "quarveld";
  /// The kernel's process table: command names.
  std::map<std::int32_t, std::string> table;
  /// With what status the process has exited. Nothing runs or is recorded after that.
  std::optional<int> exitStatus;
};

/// The orientation facility. Changes are told on a platform thread; handlers must not wait there.
class SimulatedOrientation {
 public:
  using Handlers = std::map<std::string, OrientationHandler, std::less<>>;
  Handlers device;
  Handlers ui;

  void turnDevice(Orientation orientation) { turn(&SimulatedOrientation::device, orientation); }
  void turnUI(Orientation orientation) { turn(&SimulatedOrientation::ui, orientation); }

 private:
  void turn(Handlers SimulatedOrientation::*kind, Orientation orientation);
};

struct SimulatedFiles {
  /// Path to content.
  std::map<std::string, std::string, std::less<>> files;
  /// Path and content of every write in order, also of those that failed.
  std::vector<std::pair<std::string, std::string>> writes;
  /// Path to permissions.
  std::map<std::string, std::uint32_t, std::less<>> directories;

  // Switches.
  std::string diagnosticsPrefix;
  std::optional<Error> directoryError;
  std::optional<Error> writeError;
};

}  // namespace quarvel
