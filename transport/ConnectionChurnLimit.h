#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>
#include <utility>

#include "queues/CallTracker.h"

namespace quarvel {

/// The comings and goings of clients of which work is still to be done. Each brings blocks to the
/// queue on which every client's calls are carried out; so when many are under way no client is
/// accepted until half of them are over, and those who come and go as fast as they can do not crowd
/// out those who are there.
class ConnectionChurnLimit {
 public:
  /// I/O thread. One begins; what is queued under the tracker belongs to it. `owner` keeps this
  /// object alive meanwhile.
  [[nodiscard]] CallRef begin(std::shared_ptr<const void> owner) {
    ++underWay_;
    return CallRef(std::make_shared<Change>(*this, std::move(owner)));
  }

  /// Called, from any thread, when clients may be accepted again. Constant once there are any.
  std::function<void()> wake;

  /// I/O thread. Whether nobody may be accepted; if so, `wake` will be called.
  [[nodiscard]] bool areTooMany() {
    if (underWay_ < kMost) return false;
    // Said before looking once more: one that ends in between either is seen here or sees it.
    waiting_ = true;
    if (underWay_ > kMost / 2) return true;
    waiting_ = false;
    return false;
  }

 private:
  /// What they bring is carried out in a fraction of a millisecond.
  static constexpr std::size_t kMost = 8;

  class Change final : public CallTracker {
   public:
    Change(ConnectionChurnLimit& all, std::shared_ptr<const void> owner)
        : all_(all), owner_(std::move(owner)) {}
    [[nodiscard]] std::size_t bytes() const override { return 0; }

   protected:
    void ran(std::chrono::nanoseconds /*time*/) override {}
    void carriedOut() override {}
    void completed() override { all_.ended(); }

   private:
    ConnectionChurnLimit& all_;
    const std::shared_ptr<const void> owner_;
  };

  void ended() {
    if (--underWay_ <= kMost / 2 && waiting_.exchange(false)) wake();
  }

  std::atomic<std::size_t> underWay_{0};
  std::atomic<bool> waiting_{false};
};

}  // namespace quarvel
