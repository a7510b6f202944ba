#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string_view>

namespace quarvel {

/// Whether a text is plain ASCII, the empty text too. Takes a few instructions for a short text, as
/// most are.
[[nodiscard]] inline bool IsAscii(std::string_view text) {
  constexpr std::uint64_t kHighBits = 0x8080808080808080U;
  const auto load = [&text]<class Unsigned>(Unsigned bytes, std::size_t offset) -> std::uint64_t {
    std::memcpy(&bytes, text.data() + offset, sizeof bytes);
    return bytes;
  };
  const std::size_t size = text.size();
  std::uint64_t all = 0;
  // The last step overlaps the one before, so that no rest is left.
  if (size >= 8) {
    for (std::size_t at = 0; at + 8 < size; at += 8) all |= load(std::uint64_t{}, at);
    all |= load(std::uint64_t{}, size - 8);
  } else if (size >= 4) {
    all = load(std::uint32_t{}, 0) | load(std::uint32_t{}, size - 4);
  } else {
    for (const char character : text) all |= static_cast<unsigned char>(character);
  }
  return (all & kHighBits) == 0;
}

/// Whether a text is well-formed UTF-8 (The Unicode Standard, table 3-7): no overlong forms, no
/// surrogates, nothing above U+10FFFF.
[[nodiscard]] inline bool IsUtf8(std::string_view text) {
  if (IsAscii(text)) return true;
  const auto* at = reinterpret_cast<const unsigned char*>(text.data());  // bytes above 127 positive
  const auto* const end = at + text.size();
  // Whether a byte within the text is a continuation, of a narrower range after some lead bytes.
  const auto continues = [&](std::ptrdiff_t offset, unsigned low = 0x80, unsigned high = 0xbf) {
    return end - at > offset && at[offset] >= low && at[offset] <= high;
  };
  while (at != end) {
    if (end - at >= 8) {
      std::uint64_t eight = 0;
      std::memcpy(&eight, at, sizeof eight);
      if ((eight & 0x8080808080808080U) == 0) {
        at += 8;
        continue;
      }
    }
    const unsigned lead = *at;
    if (lead < 0x80) {
      at += 1;
    } else if (lead >= 0xc2 && lead <= 0xdf) {
      if (!continues(1)) return false;
      at += 2;
    } else if (lead >= 0xe0 && lead <= 0xef) {
      const unsigned low = lead == 0xe0 ? 0xa0 : 0x80;   // below: overlong
      const unsigned high = lead == 0xed ? 0x9f : 0xbf;  // above: surrogates
      if (!continues(1, low, high) || !continues(2)) return false;
      at += 3;
    } else if (lead >= 0xf0 && lead <= 0xf4) {
      const unsigned low = lead == 0xf0 ? 0x90 : 0x80;   // below: overlong
      const unsigned high = lead == 0xf4 ? 0x8f : 0xbf;  // above: U+10FFFF
      if (!continues(1, low, high) || !continues(2) || !continues(3)) return false;
      at += 4;
    } else {
      return false;
    }
  }
  return true;
}

/// The longest beginning of UTF-8 text that has at most `bytes` bytes and ends between characters.
/// A view of `text`. Characters that combine may be parted.
[[nodiscard]] inline std::string_view Utf8Prefix(std::string_view text, std::size_t bytes) {
  if (text.size() <= bytes) return text;
  const auto isInside = [&text](std::size_t at) {
    return (static_cast<unsigned char>(text[at]) & 0xc0) == 0x80;
  };
  while (bytes > 0 && isInside(bytes)) --bytes;
  return text.substr(0, bytes);
}

}  // namespace quarvel
