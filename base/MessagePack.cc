#include "base/MessagePack.h"

#include <fmt/format.h>

#include <algorithm>
#include <utility>

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
  // Local copies: the compiler must assume that the bytes read could alias the members.
  // `position` may lie beyond the bytes received: the rest of a string is skipped unread.
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
    // Each value takes at least one byte, so a container's count bounds its bytes from below.
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

template class BasicMessagePackWriter<std::string>;

}  // namespace quarvel
