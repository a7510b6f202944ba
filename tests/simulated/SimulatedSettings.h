#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "base/Value.h"
#include "platform/Notifications.h"

namespace quarvel {

/// What the preferences hold: domain to entries.
using SimulatedPreferences = std::map<std::string, Dictionary, std::less<>>;

/// The notification facility.
class SimulatedNotifications {
 public:
  /// Switch: the error number with which registrations fail.
  std::int32_t registrationStatus = 0;

  /// Posts to every registration of that name.
  void post(std::string_view name);
  /// Calls a name's handlers with a token that is not theirs.
  void deliverForeign(std::string_view name);

  std::int32_t add(std::string_view name, NotificationToken& token, WorkQueue& queue,
                   NotificationHandler handler);
  /// For the end of the simulation.
  void release() { registrations_.clear(); }

 private:
  struct Registration {
    std::string name;
    NotificationToken token;
    WorkQueue* queue;
    NotificationHandler handler;
    bool pending = false;
  };
  static void deliver(const std::shared_ptr<Registration>& registration, NotificationToken token);

  std::vector<std::shared_ptr<Registration>> registrations_;
};

}  // namespace quarvel
