#include "platform/Notifications.h"

#include "tests/simulated/Simulation.h"

namespace quarvel {

std::int32_t RegisterForNotification(std::string_view name, NotificationToken& token,
                                     WorkQueue& queue, NotificationHandler handler) {
  SimulatedNotifications& facility = Simulation::current().notifications;
  if (facility.registrationStatus != 0) return facility.registrationStatus;
  token = static_cast<NotificationToken>(facility.registrations.size() * 100 + 100);
  facility.registrations.emplace_back(new SimulatedNotifications::Registration{
      std::string(name), token, &queue, std::move(handler)});
  return 0;
}
void SimulatedNotifications::post(std::string_view name, NotificationToken tokenOffset) {
  for (const auto& registration : registrations) {
    if (registration->name != name || registration->pending) continue;
    registration->pending = true;
    Simulation::current().arrivals.push_back({Arrival::Kind::notification, 0, nullptr});
    registration->queue->async([registration, tokenOffset] {
      registration->pending = false;
      registration->handler(registration->token + tokenOffset);
    });
  }
}

}  // namespace quarvel
