#include "platform/Log.h"

#include <atomic>
#include <map>
#include <string>
#include <utility>

#include "base/Mutex.h"
#include "platform/Clock.h"
#include "system/Configuration.h"
#include "system/LogControl.h"
#include "system/LogLine.h"
#include "system/LogWriter.h"

namespace quarvel {

// All but the switch is constant after construction.
class LogScope {
 public:
  const std::string name;
  const std::string_view subsystem;
  const std::string_view verboseKey;
  const int levelMask;
  mutable std::atomic<bool> verbose{false};
};

namespace {

constexpr std::string_view kDefaultLogName = "[default]";

std::atomic<LogLevel> leastUrgent{LogLevel::standard};

struct Scopes {
  Mutex mutex;
  std::map<std::uint32_t, const LogScope*> byCode QUARVEL_GUARDED_BY(mutex);
  std::function<void(const LogScopeSwitch&)> follower QUARVEL_GUARDED_BY(mutex);
};

// Never destroyed, like the scopes: other threads may log until the very end.
Scopes& scopes() {
  static Scopes& instance = *new Scopes;
  return instance;
}

LogScopeSwitch switchOf(LogHandle scope) {
  return {scope, scope->subsystem, scope->verboseKey};
}

}  // namespace

void SetLogLevel(LogLevel level) {
  leastUrgent.store(level, std::memory_order_relaxed);
}

void SetLogScopeVerbose(LogHandle scope, bool verbose) {
  scope->verbose.store(verbose, std::memory_order_relaxed);
}

void FollowLogScopes(const std::function<void(const LogScopeSwitch&)>& follower) {
  std::map<std::uint32_t, const LogScope*> registered;
  {
    const MutexLock lock(scopes().mutex);
    scopes().follower = follower;
    registered = scopes().byCode;
  }
  for (const auto& [code, scope] : registered) follower(switchOf(scope));
}

LogHandle ZQLogRegister(std::uint32_t code, std::string_view scope, std::string_view subsystem,
                        std::string_view verboseKey, int /*options*/, int levelMask) {
  // Who registers is about to log, and the configuration says what is written.
  static_cast<void>(Configuration::process());
  const LogScope* registered = nullptr;
  std::function<void(const LogScopeSwitch&)> follower;
  {
    const MutexLock lock(scopes().mutex);
    const LogScope*& known = scopes().byCode[code];
    if (known != nullptr) return known;
    known = registered =
        new LogScope{fmt::format("{}[{}]", subsystem, scope), subsystem, verboseKey, levelMask};
    follower = scopes().follower;
  }
  if (follower) follower(switchOf(registered));
  return registered;
}

bool ZQLogEnabled(LogLevel level, LogHandle scope) {
  if (scope != nullptr) {
    if ((scope->levelMask >> static_cast<int>(level) & 1) == 0) return false;
    if (level == LogLevel::debug) return scope->verbose.load(std::memory_order_relaxed);
  }
  return level <= leastUrgent.load(std::memory_order_relaxed);
}

void ZQLogWrite(LogHandle scope, LogLevel level, const char* file, int line, const char* function,
                std::string_view message) {
  fmt::memory_buffer buffer;
  LogWriter::instance().write(
      FormatLogLine(buffer, CurrentDate(), level,
                    scope == nullptr ? kDefaultLogName : std::string_view(scope->name), file, line,
                    function, message));
}

}  // namespace quarvel
