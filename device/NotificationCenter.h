#pragma once

#include <atomic>
#include <filesystem>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "base/Mutex.h"
#include "device/DirectoryWatch.h"
#include "platform/Notifications.h"

namespace quarvel {

/// Named notifications as files: touching, writing or replacing the file N in the directory posts
/// N. One for each process, as long as the process; `watch` must be destroyed first. Any thread;
/// handlers run on the queue of their registration.
class NotificationCenter {
 public:
  /// Makes no directory and no watch before the first registration.
  NotificationCenter(std::filesystem::path directory, DirectoryWatch& watch)
      : directory_(std::move(directory)), watch_(watch) {}

  /// Calls `handler` on `queue` with `token` after each posting of `name`, for as long as the
  /// process lives: `queue` must live as long. Postings before a queued call begins are one call.
  /// Returns 0, or the system's error number and no token when the directory cannot be watched; the
  /// next call tries again. Tokens count from 1.
  [[nodiscard]] int add(std::string_view name, NotificationToken& token, WorkQueue& queue,
                        NotificationHandler handler);

 private:
  /// One handler. Shared with its queued calls; lives as long as the process.
  struct Registration {
    Registration(NotificationToken ownToken, std::string_view ownName, WorkQueue& ownQueue,
                 NotificationHandler ownHandler)
        : token(ownToken), name(ownName), queue(ownQueue), handler(std::move(ownHandler)) {}

    const NotificationToken token;
    const std::string name;
    WorkQueue& queue;
    const NotificationHandler handler;
    std::atomic<bool> waiting = false;  // a call is queued and has not begun
  };

  /// Queues a call for each registration of `name`; an empty name stands for all.
  void post(std::string_view name);

  const std::filesystem::path directory_;
  DirectoryWatch& watch_;  // calls `post` on its thread
  Mutex mutex_;  // taken by the thread of `watch_` too; never held while a handler is queued
  // The directory exists and is watched.
  bool watching_ QUARVEL_GUARDED_BY(mutex_) = false;
  std::vector<std::shared_ptr<Registration>> registrations_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
