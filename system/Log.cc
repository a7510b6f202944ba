#include "system/Log.h"

#include <fmt/format.h>

#include <utility>
#include <vector>

#include "platform/Clock.h"

namespace quarvel {

namespace {

constexpr std::string_view kDefaultLogName = "[default]";

LogLine formatted(fmt::memory_buffer& buffer, LogHandle scope, LogLevel level, const char* file,
                  int line, const char* function, std::string_view message) {
  return FormatLogLine(buffer, CurrentDate(), level,
                       scope == nullptr ? kDefaultLogName : std::string_view(scope->name), file,
                       line, function, message);
}

}  // namespace

LogScopes& LogScopes::process() {
  // Never destroyed: other threads may log until the process ends.
  static LogScopes& scopes = *new LogScopes;
  return scopes;
}

LogHandle LogScopes::add(std::uint32_t code, std::string_view scope, std::string_view subsystem,
                         std::string_view verboseKey, int levelMask) {
  LogHandle registered = nullptr;
  Follower follower;
  {
    const MutexLock lock(mutex_);
    std::unique_ptr<const LogScope>& known = byCode_[code];
    if (known != nullptr) return known.get();
    known = std::make_unique<const LogScope>(fmt::format("{}[{}]", subsystem, scope), subsystem,
                                             verboseKey, levelMask);
    registered = known.get();
    follower = follower_;
  }
  if (follower) follower(registered);
  return registered;
}

void LogScopes::follow(const Follower& follower) {
  std::vector<LogHandle> registered;
  {
    const MutexLock lock(mutex_);
    follower_ = follower;
    for (const auto& [code, scope] : byCode_) registered.push_back(scope.get());
  }
  if (!follower) return;
  for (const LogHandle scope : registered) follower(scope);
}

bool Log::isEnabled(LogLevel line, LogHandle scope, LogLevel level) {
  if (scope != nullptr) {
    if ((scope->levelMask >> static_cast<int>(line) & 1) == 0) return false;
    if (line == LogLevel::debug) return scope->isVerbose();
  }
  return line <= level;
}

void Log::write(LogHandle scope, LogLevel level, const char* file, int line, const char* function,
                std::string_view message) {
  fmt::memory_buffer buffer;
  writer_.write(formatted(buffer, scope, level, file, line, function, message));
}

void Log::writeDirectly(LogHandle scope, LogLevel level, const char* file, int line,
                        const char* function, std::string_view message) {
  fmt::memory_buffer buffer;
  LogWriter::writeDirectly(formatted(buffer, scope, level, file, line, function, message));
}

}  // namespace quarvel
