#pragma once

#include <filesystem>
#include <memory>

#include "platform/WorkQueue.h"

namespace quarvel {

class Status;

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
  void write() const;

  const Status& status_;
  const std::filesystem::path path_;
  const std::unique_ptr<WorkQueue> queue_;
};

}  // namespace quarvel
