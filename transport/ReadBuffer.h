#pragma once

#include <cstddef>
#include <memory>
#include <span>
#include <string_view>

namespace quarvel {

/// What has arrived of one client and is not decoded yet, in one piece. Grows as bytes arrive, to
/// no more than twice what it holds, and gives the memory back when what made it grow has been
/// taken. Bytes are moved only to make room, so bytes that trickle in are moved a constant number
/// of times. Not synchronised.
class ReadBuffer {
 public:
  /// No smaller block is ever taken; what a read of a busy client brings.
  static constexpr std::size_t kSmallest = std::size_t{32} * 1024;

  [[nodiscard]] std::string_view bytes() const { return {block_.get() + begin_, end_ - begin_}; }
  [[nodiscard]] bool empty() const { return begin_ == end_; }

  /// Where the next bytes are to be written: room for an eighth of `kSmallest` at least. Moves the
  /// bytes.
  [[nodiscard]] std::span<char> room();
  /// The first `count` bytes of the room have been written.
  void arrived(std::size_t count) { end_ += count; }
  /// The first `count` bytes are done with.
  void consume(std::size_t count);
  /// Gives all memory back; precondition: empty. For a client that has nothing to say for now.
  void release();

 private:
  std::unique_ptr<char[]> block_;
  std::size_t capacity_ = 0;
  std::size_t begin_ = 0;
  std::size_t end_ = 0;
};

}  // namespace quarvel
