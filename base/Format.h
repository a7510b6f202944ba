#pragma once

#include <fmt/format.h>

#include <optional>
#include <string>
#include <string_view>

#include "base/Json.h"

namespace quarvel {

/// Stands in log lines for an object that is not there. Fixed: the lines are read by programs.
inline constexpr std::string_view kAbsentText = "(null)";

// The text of an object in a log line: dictionaries and lists as compact JSON, a string unchanged,
// an absent object as "(null)". Allocates; call it only for a line that will be written. Any
// thread.

[[nodiscard]] inline std::string Described(const Dictionary& dictionary) {
  return JsonText(dictionary);
}
/// Nil counts as absent.
[[nodiscard]] inline std::string Described(const Value& value) {
  if (value.isNil()) return std::string(kAbsentText);
  if (const std::string* text = value.string()) return *text;
  return JsonText(value);
}
[[nodiscard]] inline std::string Described(const Payload& payload) {
  return JsonText(payload);
}
[[nodiscard]] inline std::string Described(std::string text) {
  return text;
}
/// An optional object of one of the kinds above.
template <class T>
[[nodiscard]] std::string Described(const std::optional<T>& object) {
  return object ? Described(*object) : std::string(kAbsentText);
}

}  // namespace quarvel
