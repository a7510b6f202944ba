#include "store/EventSinks.h"

#include <string>
#include <utility>

namespace quarvel {

EventQueue::EventQueue(std::shared_ptr<TelemetryStore> store)
    : store_(std::move(store)),
      queue_(CreateSerialQueue("tarnwick.quarvel.events", QualityOfService::utility)) {}

template <class Add>
void EventQueue::wait(Add add) {
  ++waiting_;
  queue_->async([this, add = std::move(add)] {
    add();
    --waiting_;
  });
}

// A refusal is counted by the store, and there is nobody else to tell.

void EventQueue::addAnalyticsEvent(std::string_view name, const Payload& payload) {
  if (waiting_ == 0 && store_->addAnalyticsEventIfRoom(name, payload)) return;
  wait([this, kept = std::string(name), payload] {
    (void)store_->addAnalyticsEvent(kept, payload);
  });
}

void EventQueue::addPowerEvent(std::int32_t domain, std::string_view name, const Payload& payload) {
  if (waiting_ == 0 && store_->addPowerEventIfRoom(domain, name, payload)) return;
  wait([this, domain, kept = std::string(name), payload] {
    (void)store_->addPowerEvent(domain, kept, payload);
  });
}

}  // namespace quarvel
