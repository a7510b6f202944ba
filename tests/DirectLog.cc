// The log of a test program that links no service: lines go straight to standard error.

#include "system/Log.h"

namespace quarvel {

LogHandle ZQLogRegister(std::uint32_t code, std::string_view scope, std::string_view subsystem,
                        std::string_view verboseKey, int /*options*/, int levelMask) {
  return LogScopes::process().add(code, scope, subsystem, verboseKey, levelMask);
}

bool ZQLogEnabled(LogLevel level, LogHandle scope) {
  return Log::isEnabled(level, scope, Log::kFirstLevel);
}

void ZQLogWrite(LogHandle scope, LogLevel level, const char* file, int line, const char* function,
                std::string_view message) {
  Log::writeDirectly(scope, level, file, line, function, message);
}

}  // namespace quarvel
