#include "device/NotificationCenter.h"

#include <utility>

namespace quarvel {

int NotificationCenter::add(std::string_view name, NotificationToken& token, WorkQueue& queue,
                            NotificationHandler handler) {
  token = 0;
  const MutexLock lock(mutex_);
  if (!watching_) {
    const int status = watch_.add(directory_, [this](std::string_view file) { post(file); });
    if (status != 0) return status;
    watching_ = true;
  }
  token = static_cast<NotificationToken>(registrations_.size()) + 1;
  registrations_.push_back(std::make_shared<Registration>(token, name, queue, std::move(handler)));
  return 0;
}

void NotificationCenter::post(std::string_view name) {
  std::vector<std::shared_ptr<Registration>> found;
  {
    const MutexLock lock(mutex_);
    for (const auto& registration : registrations_) {
      if (name.empty() || registration->name == name) found.push_back(registration);
    }
  }
  for (const auto& registration : found) {
    if (registration->waiting.exchange(true)) continue;
    registration->queue.async([registration] {
      registration->waiting = false;
      registration->handler(registration->token);
    });
  }
}

}  // namespace quarvel
