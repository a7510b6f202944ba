#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <utility>

namespace quarvel {

/// Follows the work that one call of a client causes. A block that is queued while a tracker is
/// current (`CallScope`) refers to it until the block has run, and so do the blocks that this block
/// queues. The connection thus knows how much of the calls that it read is still unfinished, and
/// the blocks need not know of connections.
///
/// Owner: shared by all references (`CallRef`). Lives until the last block has run.
class CallTracker {
 public:
  virtual ~CallTracker() = default;
  /// The size of the call, for bounds on bytes.
  [[nodiscard]] virtual std::size_t bytes() const = 0;

 protected:
  // Called on the thread that made the progress; must not block.

  /// One of the call's own blocks took `time`. Before `callExecuted`.
  virtual void blockRan(std::chrono::nanoseconds time) = 0;
  /// The call, and the blocks that it queued itself, have run. Called once.
  virtual void callExecuted() = 0;
  /// The last reference has gone. Called once, after `callExecuted`. A reference that is taken
  /// later (a delayed block's, `TimerThread`) has no effect.
  virtual void callCompleted() = 0;

 private:
  friend class CallRef;

  static constexpr std::uint32_t kCompleted = std::uint32_t{1} << 31;

  /// Any thread. `direct`: of the call itself, or of a block that it queued itself.
  void addReference(bool direct) {
    references_.fetch_add(1, std::memory_order_relaxed);
    if (direct) directReferences_.fetch_add(1, std::memory_order_relaxed);
  }
  /// Any thread; the last reference of each kind reports the progress on the calling thread.
  void removeReference(bool direct) {
    if (direct && directReferences_.fetch_sub(1, std::memory_order_acq_rel) == 1) callExecuted();
    if (references_.fetch_sub(1, std::memory_order_acq_rel) != 1) return;
    // A new reference may be taken just now; then its end completes the call.
    std::uint32_t none = 0;
    if (references_.compare_exchange_strong(none, kCompleted, std::memory_order_acq_rel)) {
      callCompleted();
    }
  }

  std::atomic<std::uint32_t> references_{0};        // plus `kCompleted`, once it is
  std::atomic<std::uint32_t> directReferences_{0};  // the call's own, and its own blocks'
};

/// A counted reference that keeps a call from completing. May be empty. Movable between threads.
class CallRef {
 public:
  CallRef() = default;
  /// The call's own reference.
  explicit CallRef(std::shared_ptr<CallTracker> tracker) : CallRef(std::move(tracker), true) {}
  CallRef(CallRef&& other) noexcept : tracker_(std::move(other.tracker_)), direct_(other.direct_) {}
  CallRef& operator=(CallRef&& other) noexcept {
    std::swap(tracker_, other.tracker_);
    std::swap(direct_, other.direct_);
    return *this;
  }
  CallRef(const CallRef&) = delete;
  CallRef& operator=(const CallRef&) = delete;
  ~CallRef() {
    if (tracker_) tracker_->removeReference(direct_);
  }

  /// The tracker referred to; null when the reference is empty.
  [[nodiscard]] const std::shared_ptr<CallTracker>& tracker() const { return tracker_; }
  /// Whether it belongs to the call, or to a block that the call queued itself.
  [[nodiscard]] bool isDirect() const { return direct_ && tracker_ != nullptr; }
  /// Precondition: not empty. The block with this reference took `time`.
  void blockRan(std::chrono::nanoseconds time) const { tracker_->blockRan(time); }
  /// Whether it refers to a call.
  explicit operator bool() const { return tracker_ != nullptr; }

  /// A further reference to the tracker that is current on this thread; empty when none is.
  [[nodiscard]] static CallRef current();
  /// A further reference for work that a block caused.
  [[nodiscard]] static CallRef indirect(std::shared_ptr<CallTracker> tracker) {
    return {std::move(tracker), false};
  }

 private:
  CallRef(std::shared_ptr<CallTracker> tracker, bool direct)
      : tracker_(std::move(tracker)), direct_(direct) {
    if (tracker_) tracker_->addReference(direct_);
  }

  std::shared_ptr<CallTracker> tracker_;
  bool direct_ = false;
};

/// Makes a tracker (or none) current on this thread for a scope. Owner: the stack; `call` outlives
/// it.
class CallScope {
 public:
  /// The code that runs in the scope: the call itself, whose blocks are part of executing it, or a
  /// block, whose further blocks are not.
  enum class Of : std::uint8_t { call, block };
  /// From now on blocks that this thread queues belong to `call`; to no call when that is empty.
  CallScope(Of of, const CallRef& call);
  /// Makes the tracker of before current again: scopes nest.
  ~CallScope();
  CallScope(const CallScope&) = delete;
  CallScope& operator=(const CallScope&) = delete;

 private:
  const CallRef* previous_;
  Of previousOf_;
};

}  // namespace quarvel
