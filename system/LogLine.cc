#include "system/LogLine.h"

#include <chrono>
#include <cstdlib>
#include <ctime>

#include "base/Mutex.h"

namespace quarvel {
namespace {

std::string_view levelName(LogLevel level) {
  switch (level) {
    case LogLevel::error:
      return "error";
    case LogLevel::standard:
      return "default";
    case LogLevel::info:
      return "info";
    case LogLevel::debug:
      break;
  }
  return "debug";
}

/// A second of local time: "2026-01-31T14:25:01" and "+01:00". Without a destructor, since a thread
/// may log after its other thread-locals have gone.
struct LocalSecond {
  std::time_t second = -1;
  char text[32] = "";
  char offset[16] = "";
};

/// One per thread: local time is looked up once a second, not once per line.
const LocalSecond& localSecond(std::time_t second) {
  thread_local LocalSecond local;
  if (local.second == second) return local;
  std::tm time{};
  {
    // The C library locks by itself, but a thread sanitizer cannot see that.
    static Mutex& zone = *new Mutex;
    const MutexLock lock(zone);
    tzset();  // the device may have travelled
    localtime_r(&second, &time);
  }
  local.second = second;
  std::strftime(local.text, sizeof local.text, "%Y-%m-%dT%H:%M:%S", &time);
  const long minutes = std::abs(time.tm_gmtoff) / 60;
  *fmt::format_to_n(local.offset, sizeof local.offset - 1, "{}{:02}:{:02}",
                    time.tm_gmtoff < 0 ? '-' : '+', minutes / 60, minutes % 60)
       .out = '\0';
  return local;
}

void append(fmt::memory_buffer& out, std::string_view text) {
  out.append(text.data(), text.data() + text.size());
}

void appendOnOneLine(fmt::memory_buffer& out, std::string_view message) {
  for (std::size_t end = 0; (end = message.find('\n')) != std::string_view::npos;) {
    append(out, message.substr(0, end));
    append(out, "\\n");
    message.remove_prefix(end + 1);
  }
  append(out, message);
}

}  // namespace

LogLine FormatLogLine(fmt::memory_buffer& buffer, Date date, LogLevel level, std::string_view scope,
                      const char* file, int line, const char* function, std::string_view message) {
  const auto second = std::chrono::floor<std::chrono::seconds>(date);
  const LocalSecond& local = localSecond(std::chrono::system_clock::to_time_t(second));
  buffer.clear();
  const auto out = fmt::appender(buffer);
  fmt::format_to(out, "{}.{:06}{} {} {} ", local.text, (date - second).count(), local.offset,
                 levelName(level), scope);
  const std::size_t messageStart = buffer.size();
  fmt::format_to(out, "{}:{}:{}: ", file, line, function);
  appendOnOneLine(buffer, message);
  buffer.push_back('\n');
  return {level, scope, file, line, function, {buffer.data(), buffer.size()}, messageStart};
}

}  // namespace quarvel
