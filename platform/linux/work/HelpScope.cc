#include "platform/linux/work/HelpScope.h"

#include <cstddef>
#include <utility>
#include <vector>

#include "platform/linux/work/Activity.h"
#include "platform/linux/work/Pool.h"

namespace quarvel {

namespace {

constexpr std::chrono::milliseconds kLongest(1);

struct Adopted {
  std::shared_ptr<Lane> lane;
  Pool* pool;
};

/// One thread's, kept from scope to scope for its memory.
struct Helper {
  HelpScope* scope = nullptr;
  std::vector<Adopted> adopted;
  std::size_t next = 0;
};
thread_local Helper helper;

}  // namespace

HelpScope::HelpScope() : end_(std::chrono::steady_clock::now() + kLongest) {
  helper.scope = this;
}

HelpScope::~HelpScope() {
  exhaust();
  while (runOne()) {
  }
  helper.adopted.clear();
  helper.next = 0;
  helper.scope = nullptr;
}

bool HelpScope::runOne() {
  if (helper.next == helper.adopted.size()) return false;
  Adopted adopted = std::move(helper.adopted[helper.next++]);
  if (isExhausted() || Pool::takeTurnHere(*adopted.lane, *this)) {
    adopted.pool->submit(std::move(adopted.lane));
  }
  ActivityEnded();
  return true;
}

HelpScope* HelpScope::current() {
  return helper.scope;
}

void HelpScope::adopt(std::shared_ptr<Lane> lane, Pool& pool) {
  ActivityBegan();
  helper.adopted.push_back({std::move(lane), &pool});
}

bool HelpScope::isExhausted() {
  // Asked for each of blocks that take a microsecond: looking at the clock would be felt.
  constexpr unsigned kAsksPerLook = 8;
  if (exhausted_ || ++asked_ % kAsksPerLook != 0) return exhausted_;
  exhausted_ = std::chrono::steady_clock::now() >= end_;
  return exhausted_;
}

}  // namespace quarvel
