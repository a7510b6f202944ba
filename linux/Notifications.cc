#include "platform/Notifications.h"

#include <utility>

#include "linux/Service.h"

namespace quarvel {

std::int32_t RegisterForNotification(std::string_view name, NotificationToken& token,
                                     WorkQueue& queue, NotificationHandler handler) {
  return Service::current().notifications().add(name, token, queue, std::move(handler));
}

}  // namespace quarvel
