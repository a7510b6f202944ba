#include "platform/Preferences.h"

#include <fmt/format.h>

#include <algorithm>
#include <array>

namespace quarvel {

namespace {

bool equalIgnoringCase(std::string_view text, std::string_view lower) {
  return std::ranges::equal(text, lower, [](char a, char b) {
    return (a >= 'A' && a <= 'Z' ? static_cast<char>(a - 'A' + 'a') : a) == b;
  });
}

}  // namespace

std::optional<std::string> PreferencesDomain::string(std::string_view key) const {
  const Value* value = entries_.find(key);
  if (value == nullptr) return std::nullopt;
  if (const std::string* text = value->string()) return *text;
  if (const auto* number = value->integer()) return fmt::format("{}", *number);
  if (const auto* number = value->unsignedInteger()) return fmt::format("{}", *number);
  if (const auto* number = value->real()) return fmt::format("{}", *number);
  return std::nullopt;
}

bool PreferencesDomain::boolean(std::string_view key) const {
  static constexpr std::array<std::string_view, 4> kTrueTexts{"true", "yes", "on", "1"};
  const Value* value = entries_.find(key);
  if (value == nullptr) return false;
  if (const bool* boolean = value->boolean()) return *boolean;
  if (const auto* number = value->integer()) return *number != 0;
  if (const auto* number = value->real()) return *number != 0.0;
  if (const std::string* text = value->string()) {
    return std::ranges::any_of(
        kTrueTexts, [text](std::string_view lower) { return equalIgnoringCase(*text, lower); });
  }
  return value->unsignedInteger() != nullptr;  // always above the signed range, so never zero
}

}  // namespace quarvel
