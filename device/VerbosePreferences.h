#pragma once

#include <memory>
#include <vector>

#include "base/Mutex.h"
#include "platform/Log.h"
#include "platform/WorkQueue.h"

namespace quarvel {

/// Makes log scopes follow the preferences. Reads each scope's verbose key from its domain when the
/// scope is registered (at once for the registered ones), and again whenever the notification
/// "tarnwick.quarvel.reporting" is posted. Owned by the service, one at a time, and outlives the
/// blocks of its queue, on which later reads run.
class VerbosePreferences {
 public:
  /// Reads the preferences of the registered scopes on the calling thread. Without notifications,
  /// after a log line, nothing is read again.
  VerbosePreferences();
  VerbosePreferences(const VerbosePreferences&) = delete;
  VerbosePreferences& operator=(const VerbosePreferences&) = delete;
  /// Scopes that are registered later stay silent; the others keep their switch.
  ~VerbosePreferences();

 private:
  /// Reads one scope's switch, on the thread that registers it.
  void add(LogHandle scope) QUARVEL_EXCLUDES(mutex_);
  /// Reads all switches, each domain once, on `queue_`.
  void readAgain() QUARVEL_EXCLUDES(mutex_);

  const std::unique_ptr<WorkQueue> queue_;
  Mutex mutex_;
  std::vector<LogHandle> scopes_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
