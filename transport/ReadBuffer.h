#pragma once

#include <cstddef>
#include <memory>
#include <span>
#include <string_view>

namespace quarvel {

/// Bytes of one client that have arrived and are not decoded yet, contiguous. The block grows to at
/// most twice the bytes held and shrinks again after a large message. Bytes are moved only to make
/// room, so a message that trickles in is moved a constant number of times.
/// Owner: the connection. Thread: the I/O thread; not synchronised.
class ReadBuffer {
 public:
  /// The smallest block, 32 KiB: one read of a busy client.
  static constexpr std::size_t kSmallest = std::size_t{32} * 1024;

  /// The bytes held, from the oldest; valid until the next `room` or `release`.
  [[nodiscard]] std::string_view bytes() const { return {block_.get() + begin_, end_ - begin_}; }
  [[nodiscard]] bool empty() const { return begin_ == end_; }

  /// Free space for the next read, an eighth of `kSmallest` at least. Invalidates `bytes`.
  [[nodiscard]] std::span<char> room();
  /// The first `count` bytes of the room have been written.
  void arrived(std::size_t count) { end_ += count; }
  /// Removes the first `count` bytes. Precondition: so many are held.
  void consume(std::size_t count);
  /// Frees the block, for an idle client. Precondition: empty.
  void release();

 private:
  std::unique_ptr<char[]> block_;  // null while released
  std::size_t capacity_ = 0;       // of `block_`, in bytes
  std::size_t begin_ = 0;          // of the bytes held, from the start of `block_`
  std::size_t end_ = 0;            // behind them
};

}  // namespace quarvel
