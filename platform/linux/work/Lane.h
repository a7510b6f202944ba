#pragma once

#include <chrono>
#include <memory>
#include <string_view>
#include <utility>

#include "base/Block.h"
#include "platform/linux/work/Voucher.h"

namespace quarvel {

class HelpScope;

/// A block with the voucher under which it was queued.
struct WorkItem {
  VoucherHold voucher;
  Block block;
  bool isBrief = false;

  /// Runs the block, destroys it, and only then lets the voucher go.
  void run() {
    using Clock = std::chrono::steady_clock;
    const bool isTimed = voucher.isDirect();
    const auto began = isTimed ? Clock::now() : Clock::time_point();
    {
      const VoucherScope scope(VoucherScope::Of::block, voucher);
      block();
      block = Block();
    }
    if (isTimed) voucher.ran(Clock::now() - began);
    voucher = VoucherHold();
  }
};

/// A queue as its pool sees it: work in a line. Shared by the queue, which may go at any time, and
/// by whoever still has to run its blocks.
class Lane : public std::enable_shared_from_this<Lane> {
 public:
  explicit Lane(std::string_view label) : label_(label) {}
  virtual ~Lane() = default;
  Lane(const Lane&) = delete;
  Lane& operator=(const Lane&) = delete;

  [[nodiscard]] std::string_view label() const { return label_; }
  /// From any thread.
  virtual void add(WorkItem&& item) = 0;
  /// Runs a bounded number of blocks, so that other queues get their turn. Returns whether the lane
  /// wants another turn. On a pool's thread, once for each turn asked for.
  [[nodiscard]] virtual bool takeTurn() = 0;
  /// The same on a thread that helps, as long as blocks are brief and `help` is not exhausted.
  [[nodiscard]] virtual bool takeBriefTurn(HelpScope& help) = 0;

 private:
  const std::string_view label_;
};

}  // namespace quarvel
