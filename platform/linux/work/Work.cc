#include "platform/linux/work/Work.h"

#include "platform/linux/work/Activity.h"
#include "platform/linux/work/Keeper.h"
#include "platform/linux/work/Waits.h"

namespace quarvel {

bool DrainWork(std::chrono::steady_clock::time_point deadline) {
  EndWaits();
  Keeper::instance().endDelays();
  return WaitForNoActivity(deadline);
}

}  // namespace quarvel
