#include "platform/Clock.h"

#include "tests/simulated/Simulation.h"

namespace quarvel {

Date CurrentDate() {
  return TheScheduler().wallClock();
}
std::string LocalDateText(Date date, const char*) {
  return DateText(date);
}

}  // namespace quarvel
