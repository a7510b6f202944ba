#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace quarvel {

/// Where standard output goes, and so what it may look like.
struct Terminal {
  bool attached = false;     // to a terminal; else a pipe or a file
  bool coloured = false;     // attached, and NO_COLOR is not set or empty
  std::size_t columns = 80;  // when attached

  [[nodiscard]] static Terminal standardOutput();
};

/// Whether a descriptor leads to a terminal that wants colour.
[[nodiscard]] bool WantsColour(int descriptor);

/// How many columns UTF-8 text takes on a terminal: two for an ideograph, none for a combining
/// mark.
[[nodiscard]] std::size_t ColumnsOf(std::string_view text);
/// The text, cut with an ellipsis at its end when it takes more than `columns`, which is at least
/// 1.
[[nodiscard]] std::string Fitted(std::string_view text, std::size_t columns);
/// The text with a blank for each character that would make a terminal do something, or show the
/// rest in another order, and for each byte that is no UTF-8.
[[nodiscard]] std::string Printable(std::string_view text);

}  // namespace quarvel
