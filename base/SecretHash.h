#pragma once

#include <cstdint>
#include <cstring>
#include <random>
#include <string_view>

namespace quarvel {

/// A hash keyed with a secret of the process, for values that clients choose: no client can write
/// keys that all collide. Folded multiplication, as in wyhash (Wang Yi, 2019; public domain). May
/// be called from any thread; the secret is drawn at the first call and never changes.
class SecretHash {
 public:
  /// Differs from process to process: never store or send a hash.
  static std::uint64_t of(std::uint64_t number) {
    const auto& [first, second] = secret();
    return fold(number ^ first, second);
  }
  /// Takes the text 16 octets at a time; the last step overlaps the one before where it can.
  static std::uint64_t of(std::string_view text) {
    const auto& [first, second] = secret();
    const char* at = text.data();
    std::size_t left = text.size();
    std::uint64_t hash = first;
    for (; left > 16; left -= 16, at += 16) {
      hash = fold(load<std::uint64_t>(at) ^ second, load<std::uint64_t>(at + 8) ^ hash);
    }
    std::uint64_t low = 0;
    std::uint64_t high = 0;
    if (left >= 8) {
      low = load<std::uint64_t>(at);
      high = load<std::uint64_t>(at + left - 8);
    } else if (left >= 4) {
      low = load<std::uint32_t>(at);
      high = load<std::uint32_t>(at + left - 4);
    } else {
      for (; left > 0; --left) low = low << 8 | static_cast<unsigned char>(*at++);
    }
    return fold(second ^ text.size(), fold(low ^ second, high ^ hash));
  }

 private:
  struct Secret {
    std::uint64_t first, second;  // random, from the system
  };
  /// Drawn once: the language makes other threads wait for the first.
  static const Secret& secret() {
    static const Secret drawn = [] {
      std::random_device device;
      const auto number = [&device] { return std::uint64_t{device()} << 32 | device(); };
      return Secret{number(), number()};
    }();
    return drawn;
  }
  /// The exclusive or of the two halves of the 128-bit product.
  static std::uint64_t fold(std::uint64_t a, std::uint64_t b) {
    constexpr std::uint64_t kLow = 0xffff'ffff;
    const std::uint64_t first = (a >> 32) * (b & kLow) + ((a & kLow) * (b & kLow) >> 32);
    const std::uint64_t second = (a & kLow) * (b >> 32) + (first & kLow);
    const std::uint64_t high = (a >> 32) * (b >> 32) + (first >> 32) + (second >> 32);
    return high ^ (a * b);
  }
  /// A number at any address, in the machine's byte order.
  template <class Unsigned>
  static std::uint64_t load(const char* from) {
    Unsigned bytes;
    std::memcpy(&bytes, from, sizeof bytes);
    return bytes;
  }
};

}  // namespace quarvel
