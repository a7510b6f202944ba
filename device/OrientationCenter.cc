#include "device/OrientationCenter.h"

#include <utility>

namespace quarvel {

void OrientationCenter::add(OrientationKind kind, std::string_view callbackID,
                            OrientationHandler handler) {
  const MutexLock lock(mutex_);
  Registered& all = registered(kind);
  if (all.handlers.empty() && source_) {
    if (const auto orientation = source_->start(kind)) all.last = *orientation;
  }
  all.handlers.insert_or_assign(std::string(callbackID),
                                std::make_shared<const OrientationHandler>(std::move(handler)));
}

void OrientationCenter::remove(OrientationKind kind, std::string_view callbackID) {
  const MutexLock lock(mutex_);
  Registered& all = registered(kind);
  const auto found = all.handlers.find(callbackID);
  if (found == all.handlers.end()) return;
  const SharedHandler removed = found->second;
  all.handlers.erase(found);
  if (all.handlers.empty() && source_) source_->stop(kind);
  while (all.running == removed && all.runningOn != std::this_thread::get_id()) {
    finished_.wait(mutex_);
  }
}

void OrientationCenter::setInitial(OrientationKind kind, Orientation orientation) {
  const MutexLock lock(mutex_);
  registered(kind).last = orientation;
}

void OrientationCenter::reportChange(OrientationKind kind, Orientation orientation) {
  std::map<std::string, SharedHandler, std::less<>> handlers;
  {
    const MutexLock lock(mutex_);
    Registered& all = registered(kind);
    if (std::exchange(all.last, orientation) == orientation) return;
    handlers = all.handlers;
  }
  for (const auto& [callbackID, handler] : handlers) {
    {
      const MutexLock lock(mutex_);
      Registered& all = registered(kind);
      const auto found = all.handlers.find(callbackID);
      if (found == all.handlers.end() || found->second != handler) continue;
      all.running = handler;
      all.runningOn = std::this_thread::get_id();
    }
    (*handler)(orientation);
    const MutexLock lock(mutex_);
    registered(kind).running.reset();
    finished_.notifyAll();
  }
}

}  // namespace quarvel
