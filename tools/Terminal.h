#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace quarvel {

/// The destination of standard output, which decides on colour and width. A value.
struct Terminal {
  bool attached = false;     // standard output is a terminal; else a pipe or a file
  bool coloured = false;     // attached, and NO_COLOR is not set or empty
  std::size_t columns = 80;  // when attached

  /// As it is now; a later change of the window's size is not seen.
  [[nodiscard]] static Terminal standardOutput();
};

/// Whether a descriptor is a terminal that may be coloured.
[[nodiscard]] bool WantsColour(int descriptor);

/// The columns that UTF-8 text takes on a terminal: two for an ideograph, none for a combining
/// mark.
[[nodiscard]] std::size_t ColumnsOf(std::string_view text);
/// The text, cut with an ellipsis at its end when it takes more than `columns`, which is at least
/// 1.
[[nodiscard]] std::string Fitted(std::string_view text, std::size_t columns);
/// The text with a blank in place of each control character, each mark that changes the direction
/// of text, and each byte that is not UTF-8.
[[nodiscard]] std::string Printable(std::string_view text);

}  // namespace quarvel
