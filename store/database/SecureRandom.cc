#include "store/database/SecureRandom.h"

#include <fmt/format.h>
#include <sys/random.h>

#include <array>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <string_view>

namespace quarvel {

namespace {

using RandomBits = std::array<std::uint8_t, 16>;

RandomBits NewRandomBits() {
  RandomBits bits{};
  // A signal may interrupt the call, but never leaves 16 bytes half done.
  while (::getrandom(bits.data(), bits.size(), 0) != static_cast<ssize_t>(bits.size())) {
    if (errno != EINTR) std::abort();
  }
  return bits;
}

std::string Hexadecimal(const RandomBits& bits) {
  return fmt::format("{:02x}", fmt::join(bits, ""));
}

}  // namespace

std::string NewHierarchyToken(const std::optional<std::string>& parent) {
  const std::string own = Hexadecimal(NewRandomBits());
  return parent ? *parent + "." + own : own;
}

std::string NewUuid() {
  RandomBits bits = NewRandomBits();
  bits[6] = static_cast<std::uint8_t>((bits[6] & 0x0f) | 0x40);  // version 4
  bits[8] = static_cast<std::uint8_t>((bits[8] & 0x3f) | 0x80);  // RFC 9562's variant
  const std::string text = Hexadecimal(bits);
  const std::string_view digits = text;
  return fmt::format("{}-{}-{}-{}-{}", digits.substr(0, 8), digits.substr(8, 4),
                     digits.substr(12, 4), digits.substr(16, 4), digits.substr(20));
}

}  // namespace quarvel
