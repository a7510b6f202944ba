#pragma once

#include <array>
#include <chrono>
#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

namespace quarvel {

/// A point in time: microseconds since 1970-01-01T00:00:00Z, without leap seconds. May be before
/// 1970.
using Date = std::chrono::sys_time<std::chrono::microseconds>;

/// The dates that have an RFC 3339 text: years 1 to 9999.
inline constexpr Date kEarliestDate{std::chrono::seconds{-62'135'596'800}};
inline constexpr Date kLatestDate{std::chrono::microseconds{253'402'300'799'999'999}};

/// RFC 3339 in UTC with microseconds: "2026-01-31T13:25:01.123456Z". A date outside years 1 to 9999
/// is written as the nearest date inside.
[[nodiscard]] std::string DateText(Date date);

/// `DateText` without an allocation: 27 characters held in place.
/// A value; the view is valid as long as it.
class DateCharacters {
 public:
  /// Clamps as `DateText` does.
  explicit DateCharacters(Date date);
  operator std::string_view() const {  // NOLINT(google-explicit-constructor): it is a text
    return {characters_.data(), characters_.size()};
  }

 private:
  std::array<char, 27> characters_;  // not ended by a zero
};

/// Reads RFC 3339 text with "Z" or a numeric offset and up to nine digits of a second; digits finer
/// than a microsecond are cut off. None when the text has another form, or the year is not 1 to
/// 9999.
[[nodiscard]] std::optional<Date> DateFromText(std::string_view text);

}  // namespace quarvel
