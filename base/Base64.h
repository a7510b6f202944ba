#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace quarvel {

// Base64 with padding: RFC 4648, section 4.

/// The digit of each number from 0 to 63.
inline constexpr std::string_view kBase64Digits =
    "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

/// The text of any octets; ends with one or two "=" unless their number is a multiple of 3.
[[nodiscard]] inline std::string ToBase64(std::string_view octets) {
  std::string text;
  text.reserve((octets.size() + 2) / 3 * 4);
  for (std::size_t i = 0; i < octets.size(); i += 3) {
    const std::size_t count = std::min<std::size_t>(3, octets.size() - i);
    std::uint32_t group = 0;  // 24 bits: three octets, four digits
    for (std::size_t j = 0; j < 3; ++j) {
      group = group << 8 | (j < count ? static_cast<unsigned char>(octets[i + j]) : 0U);
    }
    for (std::size_t j = 0; j < 4; ++j) {
      text.push_back(j <= count ? kBase64Digits[group >> (18 - 6 * j) & 0x3f] : '=');
    }
  }
  return text;
}

/// The octets of a text. None when its length is not a multiple of 4, or a character is no digit;
/// blanks and line ends are none.
[[nodiscard]] inline std::optional<std::string> FromBase64(std::string_view text) {
  if (text.size() % 4 != 0) return std::nullopt;
  for (int padding = 0; padding < 2 && text.ends_with('='); ++padding) text.remove_suffix(1);
  std::string octets;
  std::uint32_t bits = 0;  // read and not yet written; the lowest `count` matter
  int count = 0;
  for (const char digit : text) {
    const std::size_t value = kBase64Digits.find(digit);
    if (value == std::string_view::npos) return std::nullopt;
    bits = bits << 6 | static_cast<std::uint32_t>(value);
    count += 6;
    if (count >= 8) {
      count -= 8;
      octets.push_back(static_cast<char>(bits >> count & 0xff));
    }
  }
  return octets;
}

}  // namespace quarvel
