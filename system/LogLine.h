#pragma once

#include <fmt/format.h>

#include <cstddef>
#include <string_view>

#include "base/Date.h"
#include "platform/Log.h"

namespace quarvel {

/// One line of the log, formatted, with what the journal wants as fields of their own. `scope`,
/// `file` and `function` outlive it; the text belongs to whoever made it.
struct LogLine {
  LogLevel level;
  std::string_view scope;
  const char* file;
  int line;
  const char* function;
  /// As standard error shows it, with the line's end: date, level, scope, then the message.
  std::string_view text;
  /// Where in `text` the message begins: "file:line:function: " and what was logged.
  std::size_t messageStart;

  [[nodiscard]] std::string_view message() const {
    return text.substr(messageStart, text.size() - messageStart - 1);
  }
};

/// The text is in `buffer`. Newlines in `message` become "\n", so that a line stays a line.
[[nodiscard]] LogLine FormatLogLine(fmt::memory_buffer& buffer, Date date, LogLevel level,
                                    std::string_view scope, const char* file, int line,
                                    const char* function, std::string_view message);

}  // namespace quarvel
