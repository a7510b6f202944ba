#pragma once

#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "base/Mutex.h"
#include "base/Value.h"

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
  /// Adds a section.
  void addSection(std::string name, Describe describe) QUARVEL_EXCLUDES(mutex_);
  /// Adds one backend, an entry of the list "backends": "name", "backlog" (rows),
  /// "last_acknowledgement" (a date or nil), "error", and further keys.
  void addBackend(Describe describe) QUARVEL_EXCLUDES(mutex_);

  /// The whole status. `docs/status.md` describes its keys.
  [[nodiscard]] Dictionary describe() const QUARVEL_EXCLUDES(mutex_);

 private:
  using Sections = std::vector<std::pair<std::string, Describe>>;

  mutable Mutex mutex_;
  std::vector<Describe> top_ QUARVEL_GUARDED_BY(mutex_);
  Sections sections_ QUARVEL_GUARDED_BY(mutex_);
  std::vector<Describe> backends_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
