#include "platform/linux/work/Work.h"

#include "platform/linux/work/Activity.h"
#include "platform/linux/work/Keeper.h"
#include "platform/linux/work/Waits.h"

namespace quarvel {

namespace {

/// What is waited for comes at once as a rule, so the work behind it is still done.
constexpr std::chrono::seconds kWaitsMayTake{2};

}  // namespace

bool DrainWork(std::chrono::steady_clock::time_point deadline) {
  EndWaits(std::chrono::time_point_cast<Date::duration>(std::chrono::system_clock::now()) +
           kWaitsMayTake);
  Keeper::instance().endDelays();
  return WaitForNoActivity(deadline);
}

}  // namespace quarvel
