#include "base/Date.h"

#include <algorithm>
#include <cstdint>

namespace quarvel {

DateCharacters::DateCharacters(Date date) {
  using namespace std::chrono;
  const Date shown = std::clamp(date, kEarliestDate, kLatestDate);
  const auto day = floor<days>(shown);
  const year_month_day calendar(day);
  const hh_mm_ss time(shown - day);
  char* at = characters_.data();
  const auto put = [&at](auto number, std::size_t digits, char after) {
    auto left = static_cast<std::uint32_t>(number);
    for (std::size_t i = digits; i-- > 0; left /= 10) at[i] = static_cast<char>('0' + left % 10);
    at[digits] = after;
    at += digits + 1;
  };
  put(static_cast<int>(calendar.year()), 4, '-');
  put(static_cast<unsigned>(calendar.month()), 2, '-');
  put(static_cast<unsigned>(calendar.day()), 2, 'T');
  put(time.hours().count(), 2, ':');
  put(time.minutes().count(), 2, ':');
  put(time.seconds().count(), 2, '.');
  put(time.subseconds().count(), 6, 'Z');
}

std::string DateText(Date date) {
  return std::string(DateCharacters(date));
}

namespace {

/// Reads from the front of a text. After a mismatch every later read fails too.
class Reader {
 public:
  explicit Reader(std::string_view text) : rest_(text) {}

  int digits(std::size_t count) {
    int number = 0;
    if (rest_.size() < count) failed_ = true;
    for (std::size_t i = 0; i < count && !failed_; ++i) number = number * 10 + digit();
    return number;
  }
  void expect(std::string_view oneOf) {
    if (rest_.empty() || oneOf.find(rest_.front()) == std::string_view::npos) {
      failed_ = true;
    } else {
      rest_.remove_prefix(1);
    }
  }
  [[nodiscard]] bool at(char character) const {
    return !rest_.empty() && rest_.front() == character;
  }
  [[nodiscard]] bool atDigit() const {
    return !rest_.empty() && rest_.front() >= '0' && rest_.front() <= '9';
  }
  int digit() {
    if (!atDigit()) {
      failed_ = true;
      return 0;
    }
    const int number = rest_.front() - '0';
    rest_.remove_prefix(1);
    return number;
  }
  [[nodiscard]] bool failed() const { return failed_; }
  [[nodiscard]] bool finished() const { return !failed_ && rest_.empty(); }

 private:
  std::string_view rest_;
  bool failed_ = false;
};

}  // namespace

std::optional<Date> DateFromText(std::string_view text) {
  using namespace std::chrono;
  Reader reader(text);
  const int year = reader.digits(4);
  reader.expect("-");
  const auto month = static_cast<unsigned>(reader.digits(2));
  reader.expect("-");
  const auto day = static_cast<unsigned>(reader.digits(2));
  reader.expect("Tt ");
  const int hour = reader.digits(2);
  reader.expect(":");
  const int minute = reader.digits(2);
  reader.expect(":");
  const int second = reader.digits(2);
  std::int64_t fraction = 0;
  if (reader.at('.')) {
    reader.expect(".");
    int count = 0;
    for (; reader.atDigit() && count < 9; ++count) {
      const int digit = reader.digit();
      if (count < 6) fraction = fraction * 10 + digit;
    }
    if (count == 0) return std::nullopt;
    for (; count < 6; ++count) fraction *= 10;
  }
  minutes offset{0};
  if (reader.at('+') || reader.at('-')) {
    const bool east = reader.at('+');
    reader.expect("+-");
    const int offsetHours = reader.digits(2);
    reader.expect(":");
    const int offsetMinutes = reader.digits(2);
    if (offsetHours > 23 || offsetMinutes > 59) return std::nullopt;
    offset = hours(offsetHours) + minutes(offsetMinutes);
    if (!east) offset = -offset;
  } else {
    reader.expect("Zz");
  }
  const year_month_day calendar{std::chrono::year(year), std::chrono::month(month),
                                std::chrono::day(day)};
  if (!reader.finished() || !calendar.ok() || hour > 23 || minute > 59 || second > 60) {
    return std::nullopt;
  }
  const Date date = sys_days(calendar) + hours(hour) + minutes(minute) + seconds(second) +
                    microseconds(fraction) - offset;
  if (date < kEarliestDate || date > kLatestDate) return std::nullopt;
  return date;
}

}  // namespace quarvel
