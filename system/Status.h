#pragma once

#include <filesystem>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "base/Mutex.h"
#include "base/Value.h"
#include "platform/WorkQueue.h"

namespace quarvel {

/// The status of the service, its owner: the facts that `quarvelctl status` shows. Each part of the
/// service adds a description of itself. Any thread.
class Status {
 public:
  /// Called whenever the status is asked for, until the service ends, on the thread that asks. It
  /// must not wait for the store, a client or a network: the status is asked for when these fail. A
  /// key "error" holds a sentence about a present fault, or nil; the service is healthy while no
  /// part has an error.
  using Describe = std::function<Dictionary()>;

  Status() = default;
  Status(const Status&) = delete;
  Status& operator=(const Status&) = delete;

  /// Adds keys at the top of the status.
  void add(Describe describe) QUARVEL_EXCLUDES(mutex_);
  /// Adds a section: the key `name`, with the part's dictionary as its value.
  void addSection(std::string name, Describe describe) QUARVEL_EXCLUDES(mutex_);
  /// Adds one backend, an entry of the list "backends": "name", "backlog" (rows),
  /// "last_acknowledgement" (a date or nil), "error", and further keys.
  void addBackend(Describe describe) QUARVEL_EXCLUDES(mutex_);

  /// The whole status: "healthy", "problems" (the parts' errors, each with the part's name), then
  /// the parts. Calls every description on the calling thread, without the lock. `docs/status.md`
  /// describes its keys.
  [[nodiscard]] Dictionary describe() const QUARVEL_EXCLUDES(mutex_);

 private:
  using Sections = std::vector<std::pair<std::string, Describe>>;

  mutable Mutex mutex_;  // not held while a part describes itself
  // In the order in which they were added.
  std::vector<Describe> top_ QUARVEL_GUARDED_BY(mutex_);
  Sections sections_ QUARVEL_GUARDED_BY(mutex_);
  std::vector<Describe> backends_ QUARVEL_GUARDED_BY(mutex_);
};

/// The notification that asks for the status.
inline constexpr const char* kStatusNotification = "tarnwick.quarvel.status";

/// Writes a status to a file in one step whenever the notification is posted, and at no other time.
/// Errors are logged; the reader then finds no new file. Owned by the service, and outlives the
/// blocks of its queue.
class StatusFile {
 public:
  /// Adds the process's own part to `status`, which outlives this, and registers for the
  /// notification.
  StatusFile(Status& status, std::filesystem::path path);
  StatusFile(const StatusFile&) = delete;
  StatusFile& operator=(const StatusFile&) = delete;

 private:
  /// Runs on `queue_`. Waits for the file system alone.
  void write() const;

  const Status& status_;
  const std::filesystem::path path_;
  const std::unique_ptr<WorkQueue> queue_;
};

}  // namespace quarvel
