#include "platform/Notifications.h"

#include "tests/simulated/Simulation.h"

namespace quarvel {

namespace {

void Deliver(const std::shared_ptr<SimulatedNotifications::Registration>& registration,
             NotificationToken token) {
  registration->queue->async([registration, token] {
    registration->pending = false;
    registration->handler(token);
  });
}

}  // namespace

void SimulatedNotifications::post(std::string_view name) {
  for (const auto& registration : registrations) {
    if (registration->name != name || registration->pending) continue;
    registration->pending = true;
    Simulation::current().arrivals.push_back({Arrival::Kind::notification, 0, nullptr});
    Deliver(registration, registration->token);
  }
}

void SimulatedNotifications::deliverForeign(std::string_view name) {
  for (const auto& registration : registrations) {
    if (registration->name == name) Deliver(registration, registration->token + 1);
  }
}

std::int32_t RegisterForNotification(std::string_view name, NotificationToken& token,
                                     WorkQueue& queue, NotificationHandler handler) {
  SimulatedNotifications& facility = Simulation::current().notifications;
  if (facility.registrationStatus != 0) return facility.registrationStatus;
  token = static_cast<NotificationToken>(facility.registrations.size() * 100 + 100);
  facility.registrations.push_back(std::make_shared<SimulatedNotifications::Registration>(
      SimulatedNotifications::Registration{std::string(name), token, &queue, std::move(handler)}));
  return 0;
}

}  // namespace quarvel
