#include "platform/Clock.h"

#include <ctime>
#include <iomanip>
#include <sstream>

namespace quarvel {

Date CurrentDate() {
  return std::chrono::time_point_cast<Date::duration>(std::chrono::system_clock::now());
}

std::string LocalDateText(Date date, const char* pattern) {
  const std::time_t seconds =
      std::chrono::system_clock::to_time_t(std::chrono::floor<std::chrono::seconds>(date));
  std::tm local{};
  localtime_r(&seconds, &local);
  std::ostringstream text;
  text << std::put_time(&local, pattern);
  return text.str();
}

}  // namespace quarvel
