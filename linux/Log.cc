#include "platform/Log.h"

#include "linux/Service.h"
#include "system/Log.h"

namespace quarvel {

LogHandle ZQLogRegister(std::uint32_t code, std::string_view scope, std::string_view subsystem,
                        std::string_view verboseKey, int /*options*/, int levelMask) {
  return LogScopes::process().add(code, scope, subsystem, verboseKey, levelMask);
}

bool ZQLogEnabled(LogLevel level, LogHandle scope) {
  const Service* const service = Service::running();
  return Log::isEnabled(level, scope,
                        service == nullptr ? Log::kFirstLevel : service->log().level());
}

void ZQLogWrite(LogHandle scope, LogLevel level, const char* file, int line, const char* function,
                std::string_view message) {
  if (Service* const service = Service::running()) {
    service->log().write(scope, level, file, line, function, message);
  } else {
    Log::writeDirectly(scope, level, file, line, function, message);
  }
}

}  // namespace quarvel
