#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <cstring>

namespace quarvel {

/// What a MessagePack value's first byte says of it. Private to base/: the scanner and the walking
/// of payloads share it.
struct MessagePackForm {
  enum class Kind : std::uint8_t {
    nil,
    boolean,
    unsignedInteger,
    integer,
    real,
    string,
    bytes,
    extension,
    list,
    dictionary,
    unused
  };

  Kind kind;
  std::uint8_t lengthBytes;  // how many bytes after the first hold a length or count
  std::uint8_t extraBytes;   // further bytes of the head: an extension's type
  std::uint8_t fixed;        // the length or count itself when lengthBytes is 0

  [[nodiscard]] static inline const MessagePackForm& of(unsigned char code);

  [[nodiscard]] std::size_t headBytes() const { return std::size_t{1} + lengthBytes + extraBytes; }
  [[nodiscard]] bool isContainer() const { return kind == Kind::list || kind == Kind::dictionary; }
  /// Bytes after the head; for containers, how many items or entries.
  [[nodiscard]] std::uint64_t length(const char* value) const {
    return lengthBytes == 0 ? fixed : bigEndian(value + 1, lengthBytes);
  }

  [[nodiscard]] static std::uint64_t bigEndian(const char* bytes, std::size_t count) {
    std::uint64_t number = 0;
    for (std::size_t i = 0; i < count; ++i) {
      number = number << 8 | static_cast<unsigned char>(bytes[i]);
    }
    return number;
  }
};

namespace message_pack_detail {

constexpr MessagePackForm FormOf(unsigned code) {
  using Kind = MessagePackForm::Kind;
  if (code <= 0x7f) return {Kind::unsignedInteger, 0, 0, 0};
  if (code <= 0x8f) return {Kind::dictionary, 0, 0, static_cast<std::uint8_t>(code & 0x0f)};
  if (code <= 0x9f) return {Kind::list, 0, 0, static_cast<std::uint8_t>(code & 0x0f)};
  if (code <= 0xbf) return {Kind::string, 0, 0, static_cast<std::uint8_t>(code & 0x1f)};
  if (code >= 0xe0) return {Kind::integer, 0, 0, 0};
  switch (code) {
    case 0xc0:
      return {Kind::nil, 0, 0, 0};
    case 0xc2:
    case 0xc3:
      return {Kind::boolean, 0, 0, 0};
    case 0xc4:
      return {Kind::bytes, 1, 0, 0};
    case 0xc5:
      return {Kind::bytes, 2, 0, 0};
    case 0xc6:
      return {Kind::bytes, 4, 0, 0};
    case 0xc7:
      return {Kind::extension, 1, 1, 0};
    case 0xc8:
      return {Kind::extension, 2, 1, 0};
    case 0xc9:
      return {Kind::extension, 4, 1, 0};
    case 0xca:
      return {Kind::real, 0, 0, 4};
    case 0xcb:
      return {Kind::real, 0, 0, 8};
    case 0xcc:
      return {Kind::unsignedInteger, 0, 0, 1};
    case 0xcd:
      return {Kind::unsignedInteger, 0, 0, 2};
    case 0xce:
      return {Kind::unsignedInteger, 0, 0, 4};
    case 0xcf:
      return {Kind::unsignedInteger, 0, 0, 8};
    case 0xd0:
      return {Kind::integer, 0, 0, 1};
    case 0xd1:
      return {Kind::integer, 0, 0, 2};
    case 0xd2:
      return {Kind::integer, 0, 0, 4};
    case 0xd3:
      return {Kind::integer, 0, 0, 8};
    case 0xd4:
      return {Kind::extension, 0, 1, 1};
    case 0xd5:
      return {Kind::extension, 0, 1, 2};
    case 0xd6:
      return {Kind::extension, 0, 1, 4};
    case 0xd7:
      return {Kind::extension, 0, 1, 8};
    case 0xd8:
      return {Kind::extension, 0, 1, 16};
    case 0xd9:
      return {Kind::string, 1, 0, 0};
    case 0xda:
      return {Kind::string, 2, 0, 0};
    case 0xdb:
      return {Kind::string, 4, 0, 0};
    case 0xdc:
      return {Kind::list, 2, 0, 0};
    case 0xdd:
      return {Kind::list, 4, 0, 0};
    case 0xde:
      return {Kind::dictionary, 2, 0, 0};
    case 0xdf:
      return {Kind::dictionary, 4, 0, 0};
    default:
      return {Kind::unused, 0, 0, 0};
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
