#pragma once

#include <algorithm>
#include <string_view>

namespace quarvel {

/// `text` without the blanks and line ends around it.
[[nodiscard]] inline std::string_view Trimmed(std::string_view text) {
  static constexpr std::string_view kBlanks = " \t\r\n";
  text.remove_prefix(std::min(text.find_first_not_of(kBlanks), text.size()));
  return text.substr(0, text.find_last_not_of(kBlanks) + 1);
}

}  // namespace quarvel
