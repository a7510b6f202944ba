#include "system/ProcessExit.h"

#include <unistd.h>

#include <utility>

#include "system/Log.h"

namespace quarvel {

void ProcessExit::add(Block work) {
  const MutexLock lock(mutex_);
  work_.push_back(std::move(work));
}

void ProcessExit::runWork() {
  while (Block work = takeLast()) work();
}

void ProcessExit::exit(int status) {
  pid_t current = 0;
  if (ending_.compare_exchange_strong(current, gettid())) {
    runWork();
  } else if (current != gettid()) {
    for (;;) pause();  // until the other thread has ended the process
  }
  log_.flush();
  _exit(status);
}

Block ProcessExit::takeLast() {
  const MutexLock lock(mutex_);
  if (work_.empty()) return {};
  Block last = std::move(work_.back());
  work_.pop_back();
  return last;
}

}  // namespace quarvel
