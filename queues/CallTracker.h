#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <utility>

namespace quarvel {

/// Stands for one call of a client for as long as any work that came of it is still to be done.
/// A block that is queued while a tracker is current holds it until the block has run, and so do
/// the blocks that this one queues; so a connection knows how much of what it took in is still
/// waiting anywhere, without the blocks knowing of connections. It is told twice: when the call
/// itself has been carried out, and when nothing that came of it is left.
class CallTracker {
 public:
  virtual ~CallTracker() = default;
  /// The size of the call, for bounds on bytes.
  [[nodiscard]] virtual std::size_t bytes() const = 0;

 protected:
  // On whatever thread it comes to pass on; must not block.

  /// One of the call's own blocks has run for so long. Before `carriedOut`.
  virtual void ran(std::chrono::nanoseconds time) = 0;

  // Each of these is called once.

  /// The call, and the blocks that it queued itself, have run.
  virtual void carriedOut() = 0;
  /// The last hold has gone; after `carriedOut`. A hold that is taken later (a delayed block's,
  /// `TimerThread`) has no effect.
  virtual void completed() = 0;

 private:
  friend class CallRef;

  static constexpr std::uint32_t kCompleted = std::uint32_t{1} << 31;

  void hold(bool direct) {
    holds_.fetch_add(1, std::memory_order_relaxed);
    if (direct) directHolds_.fetch_add(1, std::memory_order_relaxed);
  }
  void release(bool direct) {
    if (direct && directHolds_.fetch_sub(1, std::memory_order_acq_rel) == 1) carriedOut();
    if (holds_.fetch_sub(1, std::memory_order_acq_rel) != 1) return;
    // Somebody may take hold again just now, and then it is theirs to complete.
    std::uint32_t none = 0;
    if (holds_.compare_exchange_strong(none, kCompleted, std::memory_order_acq_rel)) completed();
  }

  std::atomic<std::uint32_t> holds_{0};        // plus kCompleted, once it has
  std::atomic<std::uint32_t> directHolds_{0};  // the call's own, and its own blocks'
};

/// Keeps a tracker open. May be empty.
class CallRef {
 public:
  CallRef() = default;
  /// The call's own hold.
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
    if (tracker_) tracker_->release(direct_);
  }

  [[nodiscard]] const std::shared_ptr<CallTracker>& tracker() const { return tracker_; }
  /// Whether it is of a call, or of a block that the call queued itself.
  [[nodiscard]] bool isDirect() const { return direct_ && tracker_ != nullptr; }
  /// The block that held this has run for so long.
  void ran(std::chrono::nanoseconds time) const { tracker_->ran(time); }
  explicit operator bool() const { return tracker_ != nullptr; }

  /// A further hold on the tracker that is current on this thread; empty when none is.
  [[nodiscard]] static CallRef current();
  /// A further hold for work that came of a block.
  [[nodiscard]] static CallRef indirect(std::shared_ptr<CallTracker> tracker) {
    return {std::move(tracker), false};
  }

 private:
  CallRef(std::shared_ptr<CallTracker> tracker, bool direct)
      : tracker_(std::move(tracker)), direct_(direct) {
    if (tracker_) tracker_->hold(direct_);
  }

  std::shared_ptr<CallTracker> tracker_;
  bool direct_ = false;
};

/// Makes a tracker (or none) current on this thread for a scope.
class CallScope {
 public:
  /// Who runs in the scope: the call itself, whose blocks are part of carrying it out, or a block,
  /// whose further blocks are not.
  enum class Of : std::uint8_t { call, block };
  CallScope(Of of, const CallRef& hold);
  ~CallScope();
  CallScope(const CallScope&) = delete;
  CallScope& operator=(const CallScope&) = delete;

 private:
  const CallRef* previous_;
  Of previousOf_;
};

}  // namespace quarvel
