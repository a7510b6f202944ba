#include "tools/Shown.h"

#include <fmt/format.h>

#include <ctime>

#include "base/Json.h"

namespace quarvel::commands {

std::string PathOf(const Options& options) {
  return options.store.empty() ? StoreReader::defaultPath() : options.store;
}

std::string LocalTime(Date date) {
  const auto seconds = std::chrono::floor<std::chrono::seconds>(date);
  const std::time_t time = std::chrono::system_clock::to_time_t(seconds);
  std::tm local{};
  ::localtime_r(&time, &local);
  char text[32];
  std::strftime(text, sizeof text, "%m-%d %H:%M:%S", &local);
  const auto milliseconds = std::chrono::floor<std::chrono::milliseconds>(date - seconds).count();
  return fmt::format("{}.{:03}", text, milliseconds);
}

std::string DurationOf(const StoredSession& session) {
  if (!session.flushedAt) return "not ended";
  const std::chrono::duration<double> seconds = *session.flushedAt - session.openedAt;
  return fmt::format("{:.3f} s", seconds.count());
}

std::string ShownService(std::string_view name) {
  constexpr std::string_view kSuffix = "_session";
  if (name.ends_with(kSuffix)) name.remove_suffix(kSuffix.size());
  return std::string(name);
}

std::string ApplicationOf(const std::string& userInfo) {
  const auto info = ValueFromJson(userInfo);
  const Dictionary* entries = info ? info.value().dictionary() : nullptr;
  const Value* application = entries ? entries->find("HostApplicationDisplayID") : nullptr;
  return application && application->string() ? *application->string() : "";
}

}  // namespace quarvel::commands
