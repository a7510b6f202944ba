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
  /// The messages of the error lines since the last call.
  static std::vector<std::string> takeErrors();
  /// The message of the next error line, waiting for it; empty when none came within a time that
  /// means never. The lines before it are gone.
  static std::string nextError();
};

}  // namespace quarvel::testing
