#include "system/ServiceManager.h"

#include <systemd/sd-daemon.h>

#include <atomic>
#include <cstdint>

#include "platform/WorkQueue.h"

namespace quarvel {

namespace {

// Nothing can be done for a manager that does not listen.
void Tell(const char* state) {
  static_cast<void>(::sd_notify(/*unset_environment=*/0, state));
}

}  // namespace

void TellManagerReady() {
  Tell("READY=1");
}

void TellManagerStopping() {
  Tell("STOPPING=1");
}

std::chrono::microseconds ManagerPingInterval() {
  std::uint64_t patience = 0;
  if (::sd_watchdog_enabled(/*unset_environment=*/0, &patience) <= 0) {
    return std::chrono::microseconds::zero();
  }
  return std::chrono::microseconds(patience / 2);
}

void PingManager() {
  static WorkQueue& queue =
      *CreateSerialQueue("tarnwick.quarvel.watchdog", QualityOfService::userInteractive).release();
  static std::atomic<bool> waiting{false};
  if (waiting.exchange(true)) return;
  queue.async([] {
    waiting = false;
    Tell("WATCHDOG=1");
  });
}

}  // namespace quarvel
