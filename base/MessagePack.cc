#include "base/MessagePack.h"

#include <fmt/format.h>

#include <algorithm>
#include <bit>
#include <cstring>
#include <limits>

#include "base/MessagePackForm.h"

namespace quarvel {

MessagePackScanner::MessagePackScanner(std::size_t maximumBytes, unsigned maximumDepth)
    : maximumBytes_(maximumBytes), maximumDepth_(std::min(maximumDepth, kDeepest)) {}

void MessagePackScanner::reset() {
  position_ = 0;
  left_ = 1;
  depth_ = 0;
  fault_.clear();
}

MessagePackScanner::Progress MessagePackScanner::fail(std::string reason) {
  fault_ = std::move(reason);
  return Progress::fault;
}

MessagePackScanner::Progress MessagePackScanner::scan(std::string_view bytes) {
  // Held here while the bytes are read, which might be these members for all the compiler knows.
  // `position` may lie beyond what has arrived: the rest of a string is skipped unread.
  std::size_t position = position_;
  std::uint64_t left = left_;
  unsigned depth = depth_;
  while (left > 0 && position < bytes.size()) {
    const std::uint64_t passed =
        OneByteValues(bytes.data() + position,
                      std::min({left - 1, std::uint64_t{bytes.size() - position - 1},
                                std::uint64_t{maximumBytes_ - std::min(position, maximumBytes_)}}));
    position += passed;
    left -= passed;
    const char* const value = bytes.data() + position;
    const MessagePackForm& form = MessagePackForm::at(value);
    if (form.kind == MessagePackForm::Kind::unused) {
      return fail(fmt::format("byte {} is 0xc1, which MessagePack never uses", position));
    }
    if (bytes.size() - position < form.headBytes) break;
    const std::uint64_t length = form.length(value);
    const std::uint64_t values =
        form.kind == MessagePackForm::Kind::dictionary ? 2 * length : length;
    // Each value takes a byte at least, so a container's count bounds its bytes from below.
    const std::uint64_t needed = form.headBytes + values;
    if (needed > maximumBytes_ || position > maximumBytes_ - needed) {
      return fail(
          fmt::format("the value at byte {} needs {} bytes or more; a message has at most {}",
                      position, needed, maximumBytes_));
    }
    --left;
    if (!form.isContainer()) {
      position += needed;
    } else if (depth == maximumDepth_) {
      return fail(fmt::format("the container at byte {} is nested deeper than {}", position,
                              maximumDepth_));
    } else {
      position += form.headBytes;
      leftAround_[depth++] = left;
      left = values;
    }
    while (left == 0 && depth > 0) left = leftAround_[--depth];
  }
  position_ = position;
  left_ = left;
  depth_ = depth;
  return left == 0 && position <= bytes.size() ? Progress::complete : Progress::incomplete;
}

template <class Unsigned>
void MessagePackWriter::bigEndian(Unsigned number) {
  if constexpr (std::endian::native == std::endian::little) {
    if constexpr (sizeof(Unsigned) == 2) number = __builtin_bswap16(number);
    if constexpr (sizeof(Unsigned) == 4) number = __builtin_bswap32(number);
    if constexpr (sizeof(Unsigned) == 8) number = __builtin_bswap64(number);
  }
  char octets[sizeof(Unsigned)];
  std::memcpy(octets, &number, sizeof number);
  out_.append(octets, sizeof octets);
}

void MessagePackWriter::nil() {
  head('\xc0');
}

void MessagePackWriter::boolean(bool value) {
  head(value ? '\xc3' : '\xc2');
}

void MessagePackWriter::unsignedInteger(std::uint64_t value) {
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

void MessagePackWriter::integer(std::int64_t value) {
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

void MessagePackWriter::real(double value) {
  head('\xcb');
  bigEndian(std::bit_cast<std::uint64_t>(value));
}

void MessagePackWriter::string(std::string_view text) {
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
  out_.append(text);
}

void MessagePackWriter::bytes(std::string_view octets) {
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
  out_.append(octets);
}

void MessagePackWriter::date(Date date) {
  using namespace std::chrono;
  const auto whole = floor<seconds>(date.time_since_epoch());
  const auto count = whole.count();
  const auto nanoseconds32 = static_cast<std::uint32_t>(
      duration_cast<nanoseconds>(date.time_since_epoch() - whole).count());
  if (count >= 0 && count >> 34 == 0) {
    if (nanoseconds32 == 0 && count >> 32 == 0) {
      head('\xd6');
      head('\xff');
      bigEndian(static_cast<std::uint32_t>(count));
    } else {
      head('\xd7');
      head('\xff');
      bigEndian(std::uint64_t{nanoseconds32} << 34 | static_cast<std::uint64_t>(count));
    }
  } else {
    head('\xc7');
    head('\x0c');
    head('\xff');
    bigEndian(nanoseconds32);
    bigEndian(static_cast<std::uint64_t>(count));
  }
}

void MessagePackWriter::list(std::size_t count) {
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

void MessagePackWriter::dictionary(std::size_t count) {
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

void MessagePackWriter::key(const Key& key) {
  if (const auto* text = key.string()) {
    string(*text);
  } else if (const auto* number = key.integer()) {
    integer(*number);
  } else {
    unsignedInteger(*key.unsignedInteger());
  }
}

void MessagePackWriter::value(const Value& value) {
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

void MessagePackWriter::value(const Dictionary& dictionary) {
  this->dictionary(dictionary.size());
  for (const auto& [entryKey, entryValue] : dictionary) {
    key(entryKey);
    value(entryValue);
  }
}

}  // namespace quarvel
