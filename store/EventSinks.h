#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <string_view>

#include "base/Payload.h"
#include "platform/WorkQueue.h"
#include "store/TelemetryStore.h"

namespace quarvel {

/// How events reach the store without holding back who sends them: that is the server queue, on
/// which every client waits, or the I/O thread. While the store has room they go there at once;
/// else they wait, in order, on a serial queue, where they count against the clients whose calls
/// brought them. Any thread. Outlives what it has queued.
class EventQueue {
 public:
  explicit EventQueue(std::shared_ptr<TelemetryStore> store);

  void addAnalyticsEvent(std::string_view name, const Payload& payload);
  void addPowerEvent(std::int32_t domain, std::string_view name, const Payload& payload);

 private:
  template <class Add>
  void wait(Add add);

  const std::shared_ptr<TelemetryStore> store_;
  const std::unique_ptr<WorkQueue> queue_;
  std::atomic<std::size_t> waiting_{0};  // on the queue
};

}  // namespace quarvel
