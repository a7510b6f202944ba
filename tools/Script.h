#pragma once

#include <chrono>
#include <istream>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "base/Error.h"
#include "base/Value.h"

namespace quarvel {

/// A script of calls: JSON Lines, an object a line. Empty lines and lines that begin with "#" are
/// left out.
namespace script {

/// {"call": "<full keyword name>", "args": […], "wait": true or false}
struct Call {
  std::string operation;
  List arguments;  // as written, for printing
  List values;     // as sent: {"$date": "<RFC 3339>"} is a date, {"$bytes": "<base64>"} bytes
  bool wait;       // for the reply, before the next line
};

/// {"sleep": seconds}
struct Sleep {
  std::chrono::duration<double> duration;
};

/// {"expect": value}: what the last reply must have been
struct Expect {
  Value value;
};

struct Step {
  std::size_t line;  // counted from 1
  std::variant<Call, Sleep, Expect> action;
};

/// Reads one line of a script. Errors: domain "quarvel.script", with a reason.
[[nodiscard]] Result<std::variant<Call, Sleep, Expect>> Parse(std::string_view line);

/// Whether a line is left out.
[[nodiscard]] bool IsLeftOut(std::string_view line);

}  // namespace script
}  // namespace quarvel
