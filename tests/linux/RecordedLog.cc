#include "tests/linux/RecordedLog.h"

#include "platform/Log.h"

namespace quarvel {

Collected<std::string>& RecordedErrors() {
  static Collected<std::string>& errors = *new Collected<std::string>;
  return errors;
}

LogHandle ZQLogRegister(std::uint32_t, std::string_view, std::string_view, std::string_view, int,
                        int) {
  return nullptr;
}

bool ZQLogEnabled(LogLevel level, LogHandle) {
  return level == LogLevel::error;
}

void ZQLogWrite(LogHandle, LogLevel, const char*, int, const char*, std::string_view message) {
  RecordedErrors().add(std::string(message));
}

}  // namespace quarvel
