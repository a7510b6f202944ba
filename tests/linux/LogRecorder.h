#pragma once

#include <string>
#include <vector>

#include "platform/Log.h"

namespace quarvel::testing {

/// Stands in for the system's log in tests that link no real one: keeps the lines.
struct LogRecorder {
  struct Line {
    LogLevel level;
    std::string message;
  };
  /// The lines since the last call.
  static std::vector<Line> take();
};

}  // namespace quarvel::testing
