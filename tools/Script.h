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

/// A script of calls: JSON Lines, an object a line. Empty lines and lines that begin with "#" are
/// skipped.
namespace quarvel::script {

/// {"call": "<full keyword name>", "args": […], "wait": true or false}
struct Call {
  std::string operation;  // not checked: the service knows its operations
  List arguments;         // as written, for printing
  List values;  // as sent: {"$date": "<RFC 3339>"} is a date, {"$bytes": "<base64>"} bytes
  bool wait;    // for the reply, before the next line; by default not for a start
};

/// {"sleep": seconds}
struct Sleep {
  std::chrono::duration<double> duration;  // seconds, 0 or more
};

/// {"expect": value}: the expected last reply of the calls that were waited for, as it was printed:
/// a result, or an error's dictionary. Other replies, such as a start's, do not count.
struct Expect {
  Value value;
};

using Action = std::variant<Call, Sleep, Expect>;

/// An action with its place in the file, for the text of a fault.
struct Step {
  std::size_t line;  // counted from 1
  Action action;
};

/// Reads one line of a script. Errors: domain "quarvel.script" or "quarvel.json", with a reason.
[[nodiscard]] Result<Action> Parse(std::string_view line);

/// Whether a line is empty or a comment, and so no step.
[[nodiscard]] bool IsSkipped(std::string_view line);

}  // namespace quarvel::script
