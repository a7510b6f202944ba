#include "tools/Format.h"

#include <fmt/format.h>

#include <charconv>
#include <chrono>
#include <cstdint>
#include <ctime>

#include "base/Json.h"

namespace quarvel::commands {
namespace {

using std::chrono::seconds;

std::optional<seconds> UnitOf(char letter) {
  switch (letter) {
    case 's':
      return seconds(1);
    case 'm':
      return std::chrono::minutes(1);
    case 'h':
      return std::chrono::hours(1);
    case 'd':
      return std::chrono::days(1);
    case 'w':
      return std::chrono::weeks(1);
    default:
      return std::nullopt;
  }
}

// Covers all dates, and keeps every sum of the units within 64 bits.
constexpr std::int64_t kMostOfOne = 10'000'000'000;

std::optional<seconds> DurationFromText(std::string_view text) {
  seconds sum{0};
  std::optional<seconds> last;
  while (!text.empty()) {
    std::int64_t count = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), count);
    if (error != std::errc() || count < 0 || count > kMostOfOne) return std::nullopt;
    text.remove_prefix(static_cast<std::size_t>(end - text.data()));
    const auto unit = text.empty() ? std::nullopt : UnitOf(text.front());
    if (!unit || (last && *unit >= *last)) return std::nullopt;
    sum += count * *unit;
    last = unit;
    text.remove_prefix(1);
  }
  return last ? std::optional(sum) : std::nullopt;
}

}  // namespace

std::optional<Date> Since(std::string_view text, Date now) {
  const auto ago = DurationFromText(text);
  if (!ago) return DateFromText(text);
  // Compared in seconds: the longest duration would overflow as microseconds.
  if (*ago > std::chrono::floor<seconds>(now - kEarliestDate)) return std::nullopt;
  return now - *ago;
}

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
