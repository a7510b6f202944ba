#include "transport/ReadBuffer.h"

#include <algorithm>
#include <cassert>
#include <cstring>

namespace quarvel {

std::span<char> ReadBuffer::room() {
  const std::string_view held = bytes();
  const std::size_t wanted = std::max(kSmallest, 2 * held.size());
  if (capacity_ - end_ < kSmallest / 8 || capacity_ > 4 * wanted) {
    if (capacity_ < held.size() + kSmallest / 8 || capacity_ > 4 * wanted) {
      auto larger = std::make_unique_for_overwrite<char[]>(wanted);
      std::ranges::copy(held, larger.get());
      block_ = std::move(larger);
      capacity_ = wanted;
    } else {
      std::memmove(block_.get(), held.data(), held.size());
    }
    begin_ = 0;
    end_ = held.size();
  }
  return {block_.get() + end_, capacity_ - end_};
}

void ReadBuffer::consume(std::size_t count) {
  assert(count <= end_ - begin_);
  begin_ += count;
  if (empty()) begin_ = end_ = 0;
}

void ReadBuffer::release() {
  assert(empty());
  block_.reset();
  capacity_ = begin_ = end_ = 0;
}

}  // namespace quarvel
