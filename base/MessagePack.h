#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "base/MessagePackWriter.h"
#include "base/Value.h"

// The MessagePack format: https://msgpack.org

namespace quarvel {

/// Finds where one MessagePack value ends, in bytes that are still arriving from an untrusted
/// client. Remembers how far it has looked, so that a value which arrives byte by byte is scanned
/// once; trusts no declared length before the bytes are there; allocates only the text of a fault.
/// Owned by the connection that receives the bytes; one thread at a time.
class MessagePackScanner {
 public:
  /// Deeper nesting is refused even when the caller allows more: walking is recursive.
  static constexpr unsigned kDeepest = 128;

  enum class Progress : std::uint8_t {
    incomplete,  // the value needs more bytes; call again when they have come
    complete,    // `length` is known; bytes after it belong to the next value
    fault        // the bytes can never become a value within the bounds; close the connection
  };

  /// `maximumBytes` bounds the whole value, `maximumDepth` (at most `kDeepest`) its containers in
  /// containers; the outermost container is depth 1.
  MessagePackScanner(std::size_t maximumBytes, unsigned maximumDepth);

  /// Looks at `bytes`: all that has arrived, from the value's first byte on, and perhaps more than
  /// the value. Each call must repeat at least the bytes of the call before. Costs time for the new
  /// bytes alone, and never waits. After `complete` or `fault`, call `reset` first.
  Progress scan(std::string_view bytes);

  /// After `complete`: the value's length in bytes.
  [[nodiscard]] std::size_t length() const { return position_; }
  /// After `fault`: a sentence with the fault and the allowed range, for the log.
  [[nodiscard]] const std::string& fault() const { return fault_; }
  /// Prepares for the next value.
  void reset();

 private:
  /// Keeps the reason for `fault`.
  Progress fail(std::string reason);

  std::size_t maximumBytes_;                          // of the whole value
  unsigned maximumDepth_;                             // of open containers
  std::size_t position_ = 0;                          // every byte before it is scanned or skipped
  std::uint64_t left_ = 1;                            // values left in the innermost open container
  unsigned depth_ = 0;                                // number of open containers
  std::array<std::uint64_t, kDeepest> leftAround_{};  // `left_` of each enclosing container
  std::string fault_;
};

}  // namespace quarvel
