#include "tests/simulated/SimulatedSettings.h"

#include "platform/Preferences.h"
#include "tests/simulated/Simulation.h"

namespace quarvel {

PreferencesDomain OpenPreferencesDomain(std::string_view name) {
  const auto& preferences = Simulation::current().preferences;
  const auto found = preferences.find(name);
  return found == preferences.end() ? PreferencesDomain() : PreferencesDomain(found->second);
}

void SimulatedNotifications::post(std::string_view name) {
  for (const auto& registration : registrations_) {
    if (registration->name != name || registration->pending) continue;
    registration->pending = true;
    Simulation::current().arrivals.push_back({Arrival::Kind::notification, 0, nullptr});
    deliver(registration, registration->token);
  }
}

void SimulatedNotifications::deliverForeign(std::string_view name) {
  for (const auto& registration : registrations_) {
    if (registration->name == name) deliver(registration, registration->token + 1);
  }
}

void SimulatedNotifications::deliver(const std::shared_ptr<Registration>& registration,
                                     NotificationToken token) {
  registration->queue->async([registration, token] {
    registration->pending = false;
    registration->handler(token);
  });
}

std::int32_t SimulatedNotifications::add(std::string_view name, NotificationToken& token,
                                         WorkQueue& queue, NotificationHandler handler) {
  token = static_cast<NotificationToken>(registrations_.size() * 100 + 100);
  if (registrationStatus == 0) {
    registrations_.push_back(std::make_shared<Registration>(
        Registration{std::string(name), token, &queue, std::move(handler)}));
  }
  return registrationStatus;
}

std::int32_t RegisterForNotification(std::string_view name, NotificationToken& token,
                                     WorkQueue& queue, NotificationHandler handler) {
  return Simulation::current().notifications.add(name, token, queue, std::move(handler));
}

}  // namespace quarvel
