#include "platform/Clock.h"

namespace quarvel {

Date CurrentDate() {
  return std::chrono::time_point_cast<Date::duration>(std::chrono::system_clock::now());
}

}  // namespace quarvel
