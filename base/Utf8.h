#pragma once

#include <cstdint>
#include <cstring>
#include <string_view>

namespace quarvel {

/// Whether a text is well-formed UTF-8 (The Unicode Standard, table 3-7): no overlong forms, no
/// surrogates, nothing above U+10FFFF.
[[nodiscard]] inline bool IsUtf8(std::string_view text) {
  const auto* at = reinterpret_cast<const unsigned char*>(text.data());
  const auto* const end = at + text.size();
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
      const unsigned low = lead == 0xe0 ? 0xa0 : 0x80;
      const unsigned high = lead == 0xed ? 0x9f : 0xbf;
      if (!continues(1, low, high) || !continues(2)) return false;
      at += 3;
    } else if (lead >= 0xf0 && lead <= 0xf4) {
      const unsigned low = lead == 0xf0 ? 0x90 : 0x80;
      const unsigned high = lead == 0xf4 ? 0x8f : 0xbf;
      if (!continues(1, low, high) || !continues(2) || !continues(3)) return false;
      at += 4;
    } else {
      return false;
    }
  }
  return true;
}

}  // namespace quarvel
