#include "platform/Notifications.h"

#include <utility>

#include "base/StandardPaths.h"
#include "device/NotificationCenter.h"

namespace quarvel {

namespace {

NotificationCenter& processCenter() {
  static NotificationCenter& center = *new NotificationCenter(
      StandardPaths::process().runtime / "notify", DirectoryWatch::process());
  return center;
}

}  // namespace

std::int32_t RegisterForNotification(std::string_view name, NotificationToken& token,
                                     WorkQueue& queue, NotificationHandler handler) {
  return processCenter().add(name, token, queue, std::move(handler));
}

}  // namespace quarvel
