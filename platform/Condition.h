#pragma once

#include <memory>

#include "base/Date.h"
#include "base/ThreadAnnotations.h"

namespace quarvel {

/// A lock with wait and signal, from any thread. A work queue's block that waits here delays its
/// own serial queue only (`WorkQueue`). All waits of the core go through it, so that the platform
/// sees them.
class QUARVEL_CAPABILITY("mutex") Condition {
 public:
  virtual ~Condition() = default;

  virtual void lock() QUARVEL_ACQUIRE() = 0;
  virtual void unlock() QUARVEL_RELEASE() = 0;
  /// Wakes one waiter, if there is one.
  virtual void signal() QUARVEL_REQUIRES(this) = 0;
  /// Releases the lock, waits until signalled or until the wall clock reads `deadline`, and takes
  /// the lock again. Returns false when the deadline passed. A wake-up without a signal is
  /// possible.
  virtual bool waitUntil(Date deadline) QUARVEL_REQUIRES(this) = 0;
};

/// Shared, since a waiter and its signaller may outlive each other.
[[nodiscard]] std::shared_ptr<Condition> CreateCondition();

}  // namespace quarvel
