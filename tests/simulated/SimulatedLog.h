#pragma once

#include <cstdint>
#include <set>
#include <string>
#include <vector>

#include "platform/Log.h"

namespace quarvel {

/// A scope that was registered. Lives, as its handle does, as long as the process.
class LogScope {
 public:
  std::string name;
};

struct LogLine {
  LogLevel level;
  std::string scope;  // "[default]" for the default log
  std::string function;
  std::string message;

  /// "default zqrs -[Class operation:]: message"; the journal has the same after "log ".
  [[nodiscard]] std::string text() const;
};

struct SimulatedLog {
  /// Switch: names of the scopes whose verbose lines are written.
  std::set<std::string, std::less<>> verbose;
  std::vector<LogLine> lines;

  /// The texts of the lines that begin with `prefix`.
  [[nodiscard]] std::vector<std::string> texts(std::string_view prefix = "") const;
};

}  // namespace quarvel
