#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <cstring>

namespace quarvel {

/// The form of a MessagePack value, by its first byte. An entry of a constant table, shared by the
/// scanner and the walking of payloads; for base/ alone.
struct MessagePackForm {
  /// In the order of `Value::Kind`, whose dates are extensions here.
  enum class Kind : std::uint8_t {
    nil,
    boolean,          // the first byte is the value
    integer,          // forms that can be negative
    unsignedInteger,  // forms that cannot, though small numbers may have them
    real,             // 4 or 8 bytes, IEEE 754
    string,           // UTF-8 by the format's rule, not checked here
    bytes,
    extension,  // a type of one byte, then its data; in payloads a timestamp
    list,
    dictionary,
    unused  // 0xc1, which the format forbids
  };

  Kind kind;
  std::uint8_t lengthBytes;  // bytes after the first that hold a length or count
  std::uint8_t headBytes;    // the first byte, those, and an extension's type
  std::uint8_t fixed;        // the length or count itself when lengthBytes is 0

  /// The form of values that begin with `code`.
  [[nodiscard]] static inline const MessagePackForm& of(unsigned char code);
  /// The form of the value at an address, where at least one byte must be readable.
  [[nodiscard]] static const MessagePackForm& at(const char* value) {
    return of(static_cast<unsigned char>(*value));
  }

  /// Whether the value holds other values, which follow its head.
  [[nodiscard]] bool isContainer() const { return kind == Kind::list || kind == Kind::dictionary; }
  /// The number of bytes after the head; for containers, of items or entries. Reads the
  /// bytes of the length, which must be there.
  [[nodiscard]] std::uint64_t length(const char* value) const {
    return lengthBytes == 0 ? fixed : bigEndian(value + 1, lengthBytes);
  }

  /// The big-endian number in `count` (1, 2, 4 or 8) bytes. The address needs no alignment.
  [[nodiscard]] static std::uint64_t bigEndian(const char* bytes, std::size_t count) {
    switch (count) {
      case 1:
        return static_cast<unsigned char>(*bytes);
      case 2:
        return bigEndianOf<std::uint16_t>(bytes);
      case 4:
        return bigEndianOf<std::uint32_t>(bytes);
      default:
        return bigEndianOf<std::uint64_t>(bytes);
    }
  }

 private:
  /// With a fixed number of bytes: compilers make one load and one swap of the loop.
  template <class Unsigned>
  static Unsigned bigEndianOf(const char* bytes) {
    Unsigned number = 0;
    for (std::size_t i = 0; i < sizeof number; ++i) {
      number = static_cast<Unsigned>(number << 8 | static_cast<unsigned char>(bytes[i]));
    }
    return number;
  }
};

/// The number of one-byte values (numbers, booleans, nils) at `next`, up to `most`; there must be
/// `most` bytes. Passes them at once, since a message may hold a million of them.
[[nodiscard]] inline std::uint64_t OneByteValues(const char* next, std::uint64_t most) {
  constexpr std::uint64_t kWorthIt = 16;  // for fewer the ordinary walk is as fast
  if (most < kWorthIt) return 0;
  std::uint64_t count = 0;
  while (count < most) {
    const auto code = static_cast<unsigned char>(next[count]);
    const bool isOneByte =
        code <= 0x7f || code >= 0xe0 || code == 0xc0 || code == 0xc2 || code == 0xc3;
    if (!isOneByte) break;
    ++count;
  }
  return count;
}

/// The byte after a well-formed value: a `MessagePackScanner` has found it complete, or this
/// process has written it. Needs no recursion, however deep the value is.
[[nodiscard]] inline const char* AfterMessagePack(const char* value) {
  // `left`: values still to be skipped; containers add their items.
  for (std::uint64_t left = 1; left > 0; --left) {
    const std::uint64_t passed = OneByteValues(value, left - 1);
    value += passed;
    left -= passed;
    const MessagePackForm& form = MessagePackForm::at(value);
    const std::uint64_t length = form.length(value);
    value += form.headBytes;
    if (!form.isContainer()) {
      value += length;
    } else {
      left += form.kind == MessagePackForm::Kind::list ? length : 2 * length;
    }
  }
  return value;
}

namespace message_pack_detail {

using Kind = MessagePackForm::Kind;

/// The forms of the first bytes 0xc0 to 0xdf, in order. Fields: kind, `lengthBytes`, `headBytes`,
/// `fixed`.
inline constexpr std::array<MessagePackForm, 32> kFormsFrom0xc0{{
    {Kind::nil, 0, 1, 0},              // 0xc0: nil
    {Kind::unused, 0, 1, 0},           // 0xc1: never used
    {Kind::boolean, 0, 1, 0},          // 0xc2: false
    {Kind::boolean, 0, 1, 0},          // 0xc3: true
    {Kind::bytes, 1, 2, 0},            // 0xc4: up to 2^8 - 1 bytes
    {Kind::bytes, 2, 3, 0},            // 0xc5: up to 2^16 - 1
    {Kind::bytes, 4, 5, 0},            // 0xc6: up to 2^32 - 1
    {Kind::extension, 1, 3, 0},        // 0xc7: up to 2^8 - 1 bytes
    {Kind::extension, 2, 4, 0},        // 0xc8: up to 2^16 - 1
    {Kind::extension, 4, 6, 0},        // 0xc9: up to 2^32 - 1
    {Kind::real, 0, 1, 4},             // 0xca: single precision
    {Kind::real, 0, 1, 8},             // 0xcb: double precision
    {Kind::unsignedInteger, 0, 1, 1},  // 0xcc: 8 bits
    {Kind::unsignedInteger, 0, 1, 2},  // 0xcd: 16 bits
    {Kind::unsignedInteger, 0, 1, 4},  // 0xce: 32 bits
    {Kind::unsignedInteger, 0, 1, 8},  // 0xcf: 64 bits
    {Kind::integer, 0, 1, 1},          // 0xd0: 8 bits
    {Kind::integer, 0, 1, 2},          // 0xd1: 16 bits
    {Kind::integer, 0, 1, 4},          // 0xd2: 32 bits
    {Kind::integer, 0, 1, 8},          // 0xd3: 64 bits
    {Kind::extension, 0, 2, 1},        // 0xd4: 1 byte
    {Kind::extension, 0, 2, 2},        // 0xd5: 2 bytes
    {Kind::extension, 0, 2, 4},        // 0xd6: 4 bytes: a timestamp in seconds
    {Kind::extension, 0, 2, 8},        // 0xd7: 8 bytes: a timestamp up to the year 2514
    {Kind::extension, 0, 2, 16},       // 0xd8: 16 bytes
    {Kind::string, 1, 2, 0},           // 0xd9: up to 2^8 - 1 bytes
    {Kind::string, 2, 3, 0},           // 0xda: up to 2^16 - 1
    {Kind::string, 4, 5, 0},           // 0xdb: up to 2^32 - 1
    {Kind::list, 2, 3, 0},             // 0xdc: up to 2^16 - 1 values
    {Kind::list, 4, 5, 0},             // 0xdd: up to 2^32 - 1
    {Kind::dictionary, 2, 3, 0},       // 0xde: up to 2^16 - 1 entries
    {Kind::dictionary, 4, 5, 0},       // 0xdf: up to 2^32 - 1
}};

/// The form of a first byte from 0 to 255. Below 0xc0 and above 0xdf the byte holds the number or
/// the length itself.
constexpr MessagePackForm FormOf(unsigned code) {
  const auto low = [code](unsigned mask) { return static_cast<std::uint8_t>(code & mask); };
  if (code <= 0x7f) return {Kind::unsignedInteger, 0, 1, 0};
  if (code <= 0x8f) return {Kind::dictionary, 0, 1, low(0x0f)};
  if (code <= 0x9f) return {Kind::list, 0, 1, low(0x0f)};
  if (code <= 0xbf) return {Kind::string, 0, 1, low(0x1f)};
  if (code <= 0xdf) return kFormsFrom0xc0[code - 0xc0];
  return {Kind::integer, 0, 1, 0};
}

constexpr std::array<MessagePackForm, 256> Forms() {
  std::array<MessagePackForm, 256> forms{};
  for (unsigned code = 0; code < forms.size(); ++code) forms[code] = FormOf(code);
  return forms;
}

inline constexpr std::array<MessagePackForm, 256> kForms = Forms();

}  // namespace message_pack_detail

inline const MessagePackForm& MessagePackForm::of(unsigned char code) {
  return message_pack_detail::kForms[code];
}

}  // namespace quarvel
