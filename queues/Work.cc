#include "queues/Work.h"

#include "queues/PendingWork.h"
#include "queues/TimerThread.h"
#include "queues/Waits.h"

namespace quarvel {

namespace {

/// What is waited for comes at once as a rule, so the work behind it is still done.
constexpr std::chrono::seconds kWaitsMayTake{2};

}  // namespace

bool DrainWork(std::chrono::steady_clock::time_point deadline) {
  EndWaits(std::chrono::time_point_cast<Date::duration>(std::chrono::system_clock::now()) +
           kWaitsMayTake);
  TimerThread::instance().endDelays();
  return WaitUntilIdle(deadline);
}

}  // namespace quarvel
