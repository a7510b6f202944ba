#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace quarvel {

/// Where standard output goes, and so what it may look like.
struct Terminal {
  bool attached = false;     // to a terminal; else a pipe or a file
  bool coloured = false;     // attached, and NO_COLOR is not set
  std::size_t columns = 80;  // when attached

  [[nodiscard]] static Terminal standardOutput();
};

/// How many columns UTF-8 text takes, each character counted as one.
[[nodiscard]] std::size_t ColumnsOf(std::string_view text);
/// The text, cut to `columns` with an ellipsis as its last when it is longer.
[[nodiscard]] std::string Fitted(std::string_view text, std::size_t columns);
/// The text without the characters that would make a terminal do something.
[[nodiscard]] std::string Printable(std::string_view text);

}  // namespace quarvel
