#pragma once

#include <fmt/format.h>

#include <optional>
#include <string>
#include <string_view>

#include "base/Json.h"

namespace quarvel {

inline constexpr std::string_view kAbsentText = "(null)";

// The text of an object in a log line: dictionaries and lists as compact JSON, a string unchanged,
// an absent object as "(null)".
[[nodiscard]] inline std::string Described(const Dictionary& dictionary) {
  return JsonText(dictionary);
}
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
template <class T>
[[nodiscard]] std::string Described(const std::optional<T>& object) {
  return object ? Described(*object) : std::string(kAbsentText);
}

}  // namespace quarvel
