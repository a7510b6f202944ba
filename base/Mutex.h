#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>

#include "base/ThreadAnnotations.h"

namespace quarvel {

/// A lock that Clang's thread-safety analysis sees. Lives in the object that it guards. Hold it for
/// a few lines, and call no function of another class meanwhile.
class QUARVEL_CAPABILITY("mutex") Mutex {
 public:
  Mutex() = default;
  Mutex(const Mutex&) = delete;
  Mutex& operator=(const Mutex&) = delete;

  /// Waits while another thread holds the lock. A holder that locks again waits for ever. Prefer
  /// `MutexLock`, which cannot forget to unlock.
  void lock() QUARVEL_ACQUIRE() { mutex_.lock(); }
  /// On the thread that holds the lock.
  void unlock() QUARVEL_RELEASE() { mutex_.unlock(); }

 private:
  friend class ConditionVariable;
  std::mutex mutex_;
};

/// A lock that its holder may take again: only for a locked public function that calls back into
/// its own class.
class QUARVEL_CAPABILITY("mutex") RecursiveMutex {
 public:
  RecursiveMutex() = default;
  RecursiveMutex(const RecursiveMutex&) = delete;
  RecursiveMutex& operator=(const RecursiveMutex&) = delete;

  /// Waits while another thread holds the lock; each `lock` needs its own `unlock`.
  void lock() QUARVEL_ACQUIRE() { mutex_.lock(); }
  /// On the thread that holds the lock.
  void unlock() QUARVEL_RELEASE() { mutex_.unlock(); }

 private:
  std::recursive_mutex mutex_;
};

/// Holds a lock for a scope. `Lock` is a `Mutex`, a `RecursiveMutex` or a platform's lockable.
template <class Lock>
class QUARVEL_SCOPED_CAPABILITY BasicMutexLock {
 public:
  /// Waits for the lock, which must outlive the scope.
  explicit BasicMutexLock(Lock& lock) QUARVEL_ACQUIRE(lock) : lock_(lock) { lock_.lock(); }
  ~BasicMutexLock() QUARVEL_RELEASE() { lock_.unlock(); }
  BasicMutexLock(const BasicMutexLock&) = delete;
  BasicMutexLock& operator=(const BasicMutexLock&) = delete;

 private:
  Lock& lock_;
};

using MutexLock = BasicMutexLock<Mutex>;
using RecursiveMutexLock = BasicMutexLock<RecursiveMutex>;

/// Waits for a change of the state that a `Mutex` guards. Write waits as loops: the analysis does
/// not look into predicates, and a wait may end early. For the platform and the client library; the
/// core of the service waits in `Condition`, which its platform can see.
class ConditionVariable {
 public:
  /// Releases `mutex` while it waits, and holds it again when it returns. May return without a
  /// notification.
  void wait(Mutex& mutex) QUARVEL_REQUIRES(mutex) {
    std::unique_lock<std::mutex> lock(mutex.mutex_, std::adopt_lock);
    condition_.wait(lock);
    lock.release();
  }

  /// The same until `deadline`; returns false when it has passed. Choose a steady clock: changes of
  /// the system's time move the deadlines of others.
  template <class Clock, class Duration>
  bool waitUntil(Mutex& mutex, const std::chrono::time_point<Clock, Duration>& deadline)
      QUARVEL_REQUIRES(mutex) {
    std::unique_lock<std::mutex> lock(mutex.mutex_, std::adopt_lock);
    const bool woken = condition_.wait_until(lock, deadline) == std::cv_status::no_timeout;
    lock.release();
    return woken;
  }

  // Each wakes waiting threads, one or all; without any, nothing happens. The mutex may be held.
  void notifyOne() { condition_.notify_one(); }
  void notifyAll() { condition_.notify_all(); }

 private:
  std::condition_variable condition_;
};

}  // namespace quarvel
