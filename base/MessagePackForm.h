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
    boolean,
    integer,
    unsignedInteger,
    real,
    string,
    bytes,
    extension,
    list,
    dictionary,
    unused
  };

  Kind kind;
  std::uint8_t lengthBytes;  // bytes after the first that hold a length or count
  std::uint8_t headBytes;    // the first byte, those, and an extension's type
  std::uint8_t fixed;        // the length or count itself when lengthBytes is 0

  /// The form of values that begin with `code`.
  [[nodiscard]] static inline const MessagePackForm& of(unsigned char code);
  [[nodiscard]] static const MessagePackForm& at(const char* value) {
    return of(static_cast<unsigned char>(*value));
  }

  [[nodiscard]] bool isContainer() const { return kind == Kind::list || kind == Kind::dictionary; }
  /// The number of bytes after the head; for containers, of items or entries.
  [[nodiscard]] std::uint64_t length(const char* value) const {
    return lengthBytes == 0 ? fixed : bigEndian(value + 1, lengthBytes);
  }

  /// The big-endian number in `count` (1, 2, 4 or 8) bytes.
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

/// The byte after a well-formed value. Needs no recursion, however deep the value is.
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

constexpr MessagePackForm FormOf(unsigned code) {
  using Kind = MessagePackForm::Kind;
  if (code <= 0x7f) return {Kind::unsignedInteger, 0, 1, 0};
  if (code <= 0x8f) return {Kind::dictionary, 0, 1, static_cast<std::uint8_t>(code & 0x0f)};
  if (code <= 0x9f) return {Kind::list, 0, 1, static_cast<std::uint8_t>(code & 0x0f)};
  if (code <= 0xbf) return {Kind::string, 0, 1, static_cast<std::uint8_t>(code & 0x1f)};
  if (code >= 0xe0) return {Kind::integer, 0, 1, 0};
  switch (code) {
    case 0xc0:
      return {Kind::nil, 0, 1, 0};
    case 0xc2:
    case 0xc3:
      return {Kind::boolean, 0, 1, 0};
    case 0xc4:
      return {Kind::bytes, 1, 2, 0};
    case 0xc5:
      return {Kind::bytes, 2, 3, 0};
    case 0xc6:
      return {Kind::bytes, 4, 5, 0};
    case 0xc7:
      return {Kind::extension, 1, 3, 0};
    case 0xc8:
      return {Kind::extension, 2, 4, 0};
    case 0xc9:
      return {Kind::extension, 4, 6, 0};
    case 0xca:
      return {Kind::real, 0, 1, 4};
    case 0xcb:
      return {Kind::real, 0, 1, 8};
    case 0xcc:
      return {Kind::unsignedInteger, 0, 1, 1};
    case 0xcd:
      return {Kind::unsignedInteger, 0, 1, 2};
    case 0xce:
      return {Kind::unsignedInteger, 0, 1, 4};
    case 0xcf:
      return {Kind::unsignedInteger, 0, 1, 8};
    case 0xd0:
      return {Kind::integer, 0, 1, 1};
    case 0xd1:
      return {Kind::integer, 0, 1, 2};
    case 0xd2:
      return {Kind::integer, 0, 1, 4};
    case 0xd3:
      return {Kind::integer, 0, 1, 8};
    case 0xd4:
      return {Kind::extension, 0, 2, 1};
    case 0xd5:
      return {Kind::extension, 0, 2, 2};
    case 0xd6:
      return {Kind::extension, 0, 2, 4};
    case 0xd7:
      return {Kind::extension, 0, 2, 8};
    case 0xd8:
      return {Kind::extension, 0, 2, 16};
    case 0xd9:
      return {Kind::string, 1, 2, 0};
    case 0xda:
      return {Kind::string, 2, 3, 0};
    case 0xdb:
      return {Kind::string, 4, 5, 0};
    case 0xdc:
      return {Kind::list, 2, 3, 0};
    case 0xdd:
      return {Kind::list, 4, 5, 0};
    case 0xde:
      return {Kind::dictionary, 2, 3, 0};
    case 0xdf:
      return {Kind::dictionary, 4, 5, 0};
    default:
      return {Kind::unused, 0, 1, 0};
  }
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
