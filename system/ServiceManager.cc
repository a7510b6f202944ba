#include "system/ServiceManager.h"

#include <systemd/sd-daemon.h>

#include <cstdint>

namespace quarvel {

namespace {

// A manager that does not listen cannot be helped.
void Notify(const char* state) {
  static_cast<void>(::sd_notify(/*unset_environment=*/0, state));
}

}  // namespace

ServiceManager::ServiceManager()
    : queue_(CreateSerialQueue("tarnwick.quarvel.watchdog", QualityOfService::userInteractive)) {}

void ServiceManager::reportReady() {
  Notify("READY=1");
}

void ServiceManager::reportStopping() {
  Notify("STOPPING=1");
}

std::chrono::microseconds ServiceManager::pingInterval() {
  std::uint64_t timeOut = 0;
  if (::sd_watchdog_enabled(/*unset_environment=*/0, &timeOut) <= 0) {
    return std::chrono::microseconds::zero();
  }
  return std::chrono::microseconds(timeOut / 2);
}

void ServiceManager::ping() {
  if (pinging_.exchange(true)) return;
  queue_->async([this] {
    pinging_ = false;
    Notify("WATCHDOG=1");
  });
}

}  // namespace quarvel
