#pragma once

#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "base/Mutex.h"
#include "base/Value.h"

namespace quarvel {

/// What the service tells of itself when it is asked: each part is described by whoever knows it.
/// All operations from any thread.
class Status {
 public:
  /// Called whenever the status is asked for, until the process ends, on the thread that asks. It
  /// must not wait for what the store, a client or a network may hold up: the status is asked for
  /// when these fail. A key "error" says what is wrong now, in a sentence, or holds nil; the
  /// service is healthy when nothing is wrong anywhere.
  using Describe = std::function<Dictionary()>;

  [[nodiscard]] static Status& process();

  /// Tells something under keys of its own, at the top of the status.
  void add(Describe describe) QUARVEL_EXCLUDES(mutex_);
  /// Tells something in a section of its own.
  void addSection(std::string name, Describe describe) QUARVEL_EXCLUDES(mutex_);
  /// Tells of one backend, an entry of the list "backends": "name", "backlog" (rows),
  /// "last_acknowledgement" (a date or nil), "error", and what else there is.
  void addBackend(Describe describe) QUARVEL_EXCLUDES(mutex_);

  /// The whole status. `docs/status.md` says what is in it.
  [[nodiscard]] Dictionary describe() const QUARVEL_EXCLUDES(mutex_);

 private:
  using Sections = std::vector<std::pair<std::string, Describe>>;

  mutable Mutex mutex_;
  std::vector<Describe> top_ QUARVEL_GUARDED_BY(mutex_);
  Sections sections_ QUARVEL_GUARDED_BY(mutex_);
  std::vector<Describe> backends_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
