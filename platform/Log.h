#pragma once

#include <fmt/format.h>

#include <cstdint>
#include <string_view>

namespace quarvel {

enum class LogLevel : std::uint8_t {
  error,
  standard,  // the level that logs call "default"
  info,
  debug,  // verbose lines: written only while their scope's verbose switch is on
};

/// A named part of the log, with its own verbose switch. Created by `ZQLogRegister` and never
/// destroyed; the handle may be used from any thread. Null is the process's default log.
class LogScope;
using LogHandle = const LogScope*;

/// Registers a scope; calling again with the same `code` yields the same handle. `code`: the
/// scope's four characters, the first in the most significant byte. The texts must be string
/// literals. `verboseKey` is the key, in the preferences domain `subsystem`, that switches the
/// scope's verbose lines on; the facility follows its changes. Bit n of `levelMask` admits the
/// level of number n.
[[nodiscard]] LogHandle ZQLogRegister(std::uint32_t code, std::string_view scope,
                                      std::string_view subsystem, std::string_view verboseKey,
                                      int options, int levelMask);

/// Whether a line of this level in this scope would be written. From any thread; never blocks.
/// Asked before a line is formatted.
[[nodiscard]] bool ZQLogEnabled(LogLevel level, LogHandle scope);

/// Writes one line, prefixed with `file`, `line` and `function`, which are string literals. From
/// any thread. May block while the log is full; a line that is left out is counted and reported.
/// Never fails towards the caller.
void ZQLogWrite(LogHandle scope, LogLevel level, const char* file, int line, const char* function,
                std::string_view message);

/// A scope's code from its four characters.
constexpr std::uint32_t FourCharacterCode(const char (&text)[5]) {
  std::uint32_t code = 0;
  for (int i = 0; i < 4; ++i) code = code << 8 | static_cast<unsigned char>(text[i]);
  return code;
}

}  // namespace quarvel

/// Names the function for its log lines, once, at its top: "-[Class operation:with:]", "+[…]" for a
/// class operation, the bare name for a free function.
#define ZQ_FUNCTION(name) [[maybe_unused]] static constexpr const char* kFunctionName = name

/// ZQ_LOG(scope, level, format, arguments…): formats (fmt) and writes when the level is enabled.
#define ZQ_LOG(scope, level, ...)                                                       \
  do {                                                                                  \
    if (::quarvel::ZQLogEnabled(::quarvel::LogLevel::level, scope)) {                   \
      ::quarvel::ZQLogWrite(scope, ::quarvel::LogLevel::level, __FILE_NAME__, __LINE__, \
                            kFunctionName, ::fmt::format(__VA_ARGS__));                 \
    }                                                                                   \
  } while (false)
