#include "store/EventSinks.h"

#include <fnmatch.h>

#include <algorithm>
#include <utility>

namespace quarvel {

EventQueue::EventQueue(std::shared_ptr<TelemetryStore> store)
    : store_(std::move(store)),
      queue_(CreateSerialQueue("tarnwick.quarvel.events", QualityOfService::utility)) {}

template <class Add>
void EventQueue::enqueue(Add add) {
  // Before the call: from now on later events queue up behind this one.
  ++waiting_;
  queue_->async([this, add = std::move(add)] {
    add();
    --waiting_;
  });
}

// The store counts a refusal, and an event has no reply that could tell of it.

void EventQueue::addAnalyticsEvent(std::string_view name, const Payload& payload) {
  if (waiting_ == 0 && store_->addAnalyticsEventIfRoom(name, payload)) return;
  enqueue([this, kept = std::string(name), payload] {
    (void)store_->addAnalyticsEvent(kept, payload);
  });
}

void EventQueue::addPowerEvent(std::int32_t domain, std::string_view name, const Payload& payload) {
  if (waiting_ == 0 && store_->addPowerEventIfRoom(domain, name, payload)) return;
  enqueue([this, domain, kept = std::string(name), payload] {
    (void)store_->addPowerEvent(domain, kept, payload);
  });
}

AnalyticsEventSink::AnalyticsEventSink(EventQueue& queue, std::vector<std::string> wanted)
    : queue_(queue),
      wanted_(std::move(wanted)),
      wantsAll_(std::ranges::find(wanted_, "*") != wanted_.end()) {}

void AnalyticsEventSink::sendEventLazy(std::string_view name,
                                       const std::function<Payload()>& payload) {
  if (wants(name)) queue_.addAnalyticsEvent(name, payload());
}

bool AnalyticsEventSink::wants(std::string_view name) const {
  if (wantsAll_ || wanted_.empty()) return wantsAll_;
  const std::string terminated(name);
  return std::ranges::any_of(wanted_, [&terminated](const std::string& pattern) {
    return ::fnmatch(pattern.c_str(), terminated.c_str(), 0) == 0;
  });
}

}  // namespace quarvel
