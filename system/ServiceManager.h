#pragma once

#include <atomic>
#include <chrono>
#include <memory>

#include "platform/WorkQueue.h"

namespace quarvel {

/// The service manager that started the process (systemd), on the socket that it named in
/// `$NOTIFY_SOCKET`. Without such a socket each operation does nothing. Owned by the service, and
/// outlives the blocks of its queue. Any thread.
class ServiceManager {
 public:
  /// Makes the queue of the pings; says nothing to the manager yet.
  ServiceManager();
  ServiceManager(const ServiceManager&) = delete;
  ServiceManager& operator=(const ServiceManager&) = delete;

  /// Reports that clients are served: the socket listens. Sends at once, on the calling thread.
  void reportReady();
  /// Reports that the service is ending in order. Sends like `reportReady`.
  void reportStopping();

  /// How often the manager is to hear that the process is alive: half of its time-out
  /// (`$WATCHDOG_USEC`), so that one ping may be late. Zero: never.
  [[nodiscard]] static std::chrono::microseconds pingInterval();
  /// Pings the manager once the work of clients moves: a block of their class has to get its turn.
  /// Work that waits for room in the store lends its place and does not delay the ping; work that
  /// hangs does. Returns at once; a call while a ping is queued does nothing.
  void ping();

 private:
  const std::unique_ptr<WorkQueue> queue_;  // of the clients' class
  std::atomic<bool> pinging_{false};        // a ping is queued
};

}  // namespace quarvel
