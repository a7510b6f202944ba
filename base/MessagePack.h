#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "base/Value.h"

// The MessagePack format: https://msgpack.org

namespace quarvel {

/// Finds where one MessagePack value ends in bytes that are still arriving and come from somebody
/// who may lie. Remembers how far it has looked, so bytes that trickle in are scanned once; trusts
/// no declared length before the bytes are there; allocates nothing.
class MessagePackScanner {
 public:
  /// Deeper nesting than this is refused whatever the caller allows: walking is recursive.
  static constexpr unsigned kDeepest = 128;

  enum class Progress : std::uint8_t { incomplete, complete, fault };

  /// `maximumBytes` bounds the whole value, `maximumDepth` (at most `kDeepest`) its containers in
  /// containers; the outermost container is depth 1.
  MessagePackScanner(std::size_t maximumBytes, unsigned maximumDepth);

  /// Looks at `bytes`, which begin with the value's first byte and hold all that has arrived of it
  /// (and perhaps more). Each call must repeat at least what the one before it was given.
  Progress scan(std::string_view bytes);

  /// After `complete`: the value's length in bytes.
  [[nodiscard]] std::size_t length() const { return position_; }
  /// After `fault`: what was wrong and what is allowed, a sentence.
  [[nodiscard]] const std::string& fault() const { return fault_; }
  /// Makes ready for the next value.
  void reset();

 private:
  Progress fail(std::string reason);

  std::size_t maximumBytes_;
  unsigned maximumDepth_;
  std::size_t position_ = 0;  // every byte before it has been looked at, or is to be skipped
  std::uint64_t left_ = 1;    // values still to come in the innermost open container
  unsigned depth_ = 0;        // containers that are open
  std::array<std::uint64_t, kDeepest> leftAround_{};  // the same around each of them
  std::string fault_;
};

/// Appends MessagePack to a string, each value in its shortest form.
class MessagePackWriter {
 public:
  /// `out` must outlive the writer.
  explicit MessagePackWriter(std::string& out) : out_(out) {}

  void nil();
  void boolean(bool value);
  void integer(std::int64_t value);
  void unsignedInteger(std::uint64_t value);
  void real(double value);
  void string(std::string_view text);
  void bytes(std::string_view octets);
  void date(Date date);
  /// The head of a list; `count` values follow.
  void list(std::size_t count);
  /// The head of a dictionary; `count` times a key and a value follow.
  void dictionary(std::size_t count);
  /// A value that is MessagePack already.
  void encoded(std::string_view value) { out_.append(value); }

  void key(const Key& key);
  void value(const Value& value);
  void value(const Dictionary& dictionary);

 private:
  void head(char code) { out_.push_back(code); }
  template <class Unsigned>
  void bigEndian(Unsigned number);

  std::string& out_;
};

}  // namespace quarvel
