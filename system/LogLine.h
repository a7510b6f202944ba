#pragma once

#include <fmt/format.h>

#include <cstddef>
#include <string_view>

#include "base/Date.h"
#include "platform/Log.h"

namespace quarvel {

/// One formatted line of the log, and the parts that the journal keeps as fields of their own. A
/// view: `scope`, `file` and `function` live as long as the process, the text is its maker's.
struct LogLine {
  LogLevel level;
  std::string_view scope;
  const char* file;
  int line;
  const char* function;
  /// The line on standard error, with its end: date, level, scope, then the message.
  std::string_view text;
  /// The place in `text` where "file:line:function: " and the logged text begin.
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
