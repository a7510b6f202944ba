#pragma once

#include <bit>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <limits>
#include <string>
#include <string_view>

#include "base/Value.h"

namespace quarvel {

/// Appends MessagePack to a sink, each value in its shortest form. The sink has the `push_back` and
/// `append` of a string; the writer itself allocates nothing and keeps no state, so with a sink of
/// fixed memory all functions but `key` and `value` suit a real-time thread.
template <class Sink>
class BasicMessagePackWriter {
 public:
  /// `out` must outlive the writer.
  explicit BasicMessagePackWriter(Sink& out) : out_(out) {}

  // Each appends one value. An exception of the sink, such as a lack of memory, passes through, and
  // leaves a value written in part.

  void nil() { head('\xc0'); }
  void boolean(bool value) { head(value ? '\xc3' : '\xc2'); }
  // A number takes 1, 2, 3, 5 or 9 bytes; a positive one is written unsigned in both functions.
  void integer(std::int64_t value);
  void unsignedInteger(std::uint64_t value);
  /// Always 9 bytes: a double stays a double.
  void real(double value);
  /// `text` must be UTF-8 and have at most 2^32 - 1 bytes, which is not checked.
  void string(std::string_view text);
  /// Octets without a meaning, at most 2^32 - 1.
  void bytes(std::string_view octets);
  /// The timestamp extension, in the shortest of its three forms: 6, 10 or 15 bytes.
  void date(Date date);
  /// The head of a list; the caller then writes `count` values, at most 2^32 - 1. Nothing checks
  /// that it does.
  void list(std::size_t count);
  /// The head of a dictionary; the caller then writes `count` times a key (`string`, `integer` or
  /// `key`) and a value. Nothing checks that it does.
  void dictionary(std::size_t count);
  /// A value that is MessagePack already, appended unchanged and unchecked.
  void encoded(std::string_view value) { out_.append(value.data(), value.size()); }

  // Trees, with all that they hold. Recursive: as deep as the tree.
  void key(const Key& key);
  void value(const Value& value);
  void value(const Dictionary& dictionary);

 private:
  /// Appends the first byte of a value, or an extension's type.
  void head(char code) { out_.push_back(code); }
  /// Appends a number of 1, 2, 4 or 8 bytes behind a head.
  template <class Unsigned>
  void bigEndian(Unsigned number);

  Sink& out_;
};

/// The writer of the service and of ordinary clients, which appends to a string.
using MessagePackWriter = BasicMessagePackWriter<std::string>;
extern template class BasicMessagePackWriter<std::string>;  // MessagePack.cc

template <class Sink>
template <class Unsigned>
void BasicMessagePackWriter<Sink>::bigEndian(Unsigned number) {
  if constexpr (std::endian::native == std::endian::little) {
    if constexpr (sizeof(Unsigned) == 2) number = __builtin_bswap16(number);
    if constexpr (sizeof(Unsigned) == 4) number = __builtin_bswap32(number);
    if constexpr (sizeof(Unsigned) == 8) number = __builtin_bswap64(number);
  }
  char octets[sizeof(Unsigned)];
  std::memcpy(octets, &number, sizeof number);
  out_.append(octets, sizeof octets);
}

template <class Sink>
void BasicMessagePackWriter<Sink>::unsignedInteger(std::uint64_t value) {
  if (value < 128) {
    head(static_cast<char>(value));
  } else if (value <= std::numeric_limits<std::uint8_t>::max()) {
    head('\xcc');
    bigEndian(static_cast<std::uint8_t>(value));
  } else if (value <= std::numeric_limits<std::uint16_t>::max()) {
    head('\xcd');
    bigEndian(static_cast<std::uint16_t>(value));
  } else if (value <= std::numeric_limits<std::uint32_t>::max()) {
    head('\xce');
    bigEndian(static_cast<std::uint32_t>(value));
  } else {
    head('\xcf');
    bigEndian(value);
  }
}

template <class Sink>
void BasicMessagePackWriter<Sink>::integer(std::int64_t value) {
  if (value >= 0) {
    unsignedInteger(static_cast<std::uint64_t>(value));
  } else if (value >= -32) {
    head(static_cast<char>(value));
  } else if (value >= std::numeric_limits<std::int8_t>::min()) {
    head('\xd0');
    bigEndian(static_cast<std::uint8_t>(value));
  } else if (value >= std::numeric_limits<std::int16_t>::min()) {
    head('\xd1');
    bigEndian(static_cast<std::uint16_t>(value));
  } else if (value >= std::numeric_limits<std::int32_t>::min()) {
    head('\xd2');
    bigEndian(static_cast<std::uint32_t>(value));
  } else {
    head('\xd3');
    bigEndian(static_cast<std::uint64_t>(value));
  }
}

template <class Sink>
void BasicMessagePackWriter<Sink>::real(double value) {
  head('\xcb');
  bigEndian(std::bit_cast<std::uint64_t>(value));
}

template <class Sink>
void BasicMessagePackWriter<Sink>::string(std::string_view text) {
  if (text.size() < 32) {
    head(static_cast<char>(0xa0 | text.size()));
  } else if (text.size() <= std::numeric_limits<std::uint8_t>::max()) {
    head('\xd9');
    bigEndian(static_cast<std::uint8_t>(text.size()));
  } else if (text.size() <= std::numeric_limits<std::uint16_t>::max()) {
    head('\xda');
    bigEndian(static_cast<std::uint16_t>(text.size()));
  } else {
    head('\xdb');
    bigEndian(static_cast<std::uint32_t>(text.size()));
  }
  out_.append(text.data(), text.size());
}

template <class Sink>
void BasicMessagePackWriter<Sink>::bytes(std::string_view octets) {
  if (octets.size() <= std::numeric_limits<std::uint8_t>::max()) {
    head('\xc4');
    bigEndian(static_cast<std::uint8_t>(octets.size()));
  } else if (octets.size() <= std::numeric_limits<std::uint16_t>::max()) {
    head('\xc5');
    bigEndian(static_cast<std::uint16_t>(octets.size()));
  } else {
    head('\xc6');
    bigEndian(static_cast<std::uint32_t>(octets.size()));
  }
  out_.append(octets.data(), octets.size());
}

template <class Sink>
void BasicMessagePackWriter<Sink>::date(Date date) {
  using namespace std::chrono;
  // Rounded down, so that the part of a second is positive before 1970 too.
  const auto whole = floor<seconds>(date.time_since_epoch());
  const auto count = whole.count();
  const auto nanoseconds32 = static_cast<std::uint32_t>(
      duration_cast<nanoseconds>(date.time_since_epoch() - whole).count());
  // The short forms have 32 or 34 bits for the seconds, and no sign.
  if (count >= 0 && count >> 34 == 0) {
    if (nanoseconds32 == 0 && count >> 32 == 0) {
      head('\xd6');  // 4 bytes of data
      head('\xff');
      bigEndian(static_cast<std::uint32_t>(count));
    } else {
      head('\xd7');  // 8
      head('\xff');
      bigEndian(std::uint64_t{nanoseconds32} << 34 | static_cast<std::uint64_t>(count));
    }
  } else {
    head('\xc7');
    head('\x0c');  // 12
    head('\xff');
    bigEndian(nanoseconds32);
    bigEndian(static_cast<std::uint64_t>(count));
  }
}

template <class Sink>
void BasicMessagePackWriter<Sink>::list(std::size_t count) {
  if (count < 16) {
    head(static_cast<char>(0x90 | count));
  } else if (count <= std::numeric_limits<std::uint16_t>::max()) {
    head('\xdc');
    bigEndian(static_cast<std::uint16_t>(count));
  } else {
    head('\xdd');
    bigEndian(static_cast<std::uint32_t>(count));
  }
}

template <class Sink>
void BasicMessagePackWriter<Sink>::dictionary(std::size_t count) {
  if (count < 16) {
    head(static_cast<char>(0x80 | count));
  } else if (count <= std::numeric_limits<std::uint16_t>::max()) {
    head('\xde');
    bigEndian(static_cast<std::uint16_t>(count));
  } else {
    head('\xdf');
    bigEndian(static_cast<std::uint32_t>(count));
  }
}

template <class Sink>
void BasicMessagePackWriter<Sink>::key(const Key& key) {
  if (const auto* text = key.string()) {
    string(*text);
  } else if (const auto* number = key.integer()) {
    integer(*number);
  } else {
    unsignedInteger(*key.unsignedInteger());
  }
}

template <class Sink>
void BasicMessagePackWriter<Sink>::value(const Value& value) {
  switch (value.kind()) {
    case Value::Kind::nil:
      return nil();
    case Value::Kind::boolean:
      return boolean(*value.boolean());
    case Value::Kind::integer:
      return integer(*value.integer());
    case Value::Kind::unsignedInteger:
      return unsignedInteger(*value.unsignedInteger());
    case Value::Kind::real:
      return real(*value.real());
    case Value::Kind::string:
      return string(*value.string());
    case Value::Kind::bytes:
      return bytes(value.bytes()->octets);
    case Value::Kind::date:
      return date(*value.date());
    case Value::Kind::list:
      list(value.list()->size());
      for (const Value& item : *value.list()) this->value(item);
      return;
    case Value::Kind::dictionary:
      return this->value(*value.dictionary());
  }
}

template <class Sink>
void BasicMessagePackWriter<Sink>::value(const Dictionary& dictionary) {
  this->dictionary(dictionary.size());
  for (const auto& [entryKey, entryValue] : dictionary) {
    key(entryKey);
    value(entryValue);
  }
}

}  // namespace quarvel
