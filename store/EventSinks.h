#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "base/Payload.h"
#include "platform/WorkQueue.h"
#include "store/TelemetryStore.h"

namespace quarvel {

/// Adds events to the store without blocking the sender: that is the server queue, on which every
/// client waits, or the I/O thread. While the store has room, events go there at once. Otherwise
/// they wait, in order, on a serial queue, where they count against the clients whose calls made
/// them.
///
/// Owned by the service; must outlive the events it has queued. Any thread.
class EventQueue {
 public:
  /// Shares the store; its serial queue runs at utility priority.
  explicit EventQueue(std::shared_ptr<TelemetryStore> store);

  // Any thread; never wait for room. A refusal (store closed, event too large) is counted by the
  // store and reported to no caller. Events of one caller are stored in the order of its calls.

  void addAnalyticsEvent(std::string_view name, const Payload& payload);
  /// `domain` is stored as given.
  void addPowerEvent(std::int32_t domain, std::string_view name, const Payload& payload);

 private:
  /// Runs `add` on the serial queue, where it may wait for room.
  template <class Add>
  void enqueue(Add add);

  const std::shared_ptr<TelemetryStore> store_;
  const std::unique_ptr<WorkQueue> queue_;
  std::atomic<std::size_t> waiting_{0};  // on the queue
};

/// The analytics event sink: adds the events that the configuration wants to an `EventQueue`.
///
/// Owned by the service, as long as the queue lives. Any thread.
class AnalyticsEventSink {
 public:
  /// `queue` must outlive the sink. `wanted`: shell patterns ("*", "?", "[...]") of event names; an
  /// event that matches none is not wanted.
  AnalyticsEventSink(EventQueue& queue, std::vector<std::string> wanted);

  /// Implements `VistrelSendEventLazy`: calls `payload` at once, on this thread, and only for an
  /// event that is wanted.
  void sendEventLazy(std::string_view name, const std::function<Payload()>& payload);

 private:
  [[nodiscard]] bool wants(std::string_view name) const;

  EventQueue& queue_;
  const std::vector<std::string> wanted_;
  const bool wantsAll_;  // "*" is among them, so that no pattern has to be tried
};

}  // namespace quarvel
