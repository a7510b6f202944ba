#include "tools/Since.h"

#include <charconv>
#include <chrono>
#include <cstdint>

namespace quarvel {
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

// Enough for the whole of time, and few enough that no sum overflows.
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
  // In seconds: as microseconds the longest would overflow.
  if (*ago > std::chrono::floor<seconds>(now - kEarliestDate)) return std::nullopt;
  return now - *ago;
}

}  // namespace quarvel
