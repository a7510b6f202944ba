#include "platform/linux/connection/CallDesk.h"

#include <algorithm>
#include <utility>

#include "base/MessagePack.h"

namespace quarvel {

namespace {

constexpr std::int64_t kResponse = 1;

// Half a turn that takes longer than this makes the next ones shorter; one that takes less, longer.
constexpr std::chrono::microseconds kSlow{500};
constexpr std::chrono::microseconds kFast{125};

/// What the store takes in a few milliseconds.
constexpr std::size_t kMostBehind = 128;

/// A buffer that has grown beyond this for a burst is not kept for the quiet that follows.
constexpr std::size_t kKeptCapacity = std::size_t{64} * 1024;

void Empty(std::string& buffer) {
  if (buffer.capacity() > kKeptCapacity) {
    buffer = std::string();
  } else {
    buffer.clear();
  }
}

}  // namespace

CallDesk::CallDesk(const Configuration::Limits& limits, std::function<void()> wake)
    : replyBytesLimit_(limits.replyBytes),
      callsLimit_(limits.queuedCalls),
      bytesLimit_(limits.queuedBytes),
      wake_(std::move(wake)),
      turn_(std::min(limits.firstTurn, callsLimit_)) {}

template <class Encode>
void CallDesk::reply(Encode encode) {
  bool wakes = false;
  {
    MutexLock lock(mutex_);
    if (refused_) return;
    const std::size_t before = replies_.size();
    MessagePackWriter writer(replies_);
    writer.list(4);
    writer.integer(kResponse);
    encode(writer);
    const std::size_t added = replies_.size() - before;
    const std::size_t held = repliesHeld_.fetch_add(added);
    // A client that does not read is watched from the moment on at which too much is held for it.
    const bool passesLimit = held < replyBytesLimit_ && held + added >= replyBytesLimit_;
    wakes = !std::exchange(wakeRequested_, true) || passesLimit;
  }
  if (wakes) wake_();
}

void CallDesk::result(std::uint32_t messageID, const Value& value) {
  reply([&](MessagePackWriter& writer) {
    writer.unsignedInteger(messageID);
    writer.nil();
    writer.value(value);
  });
}

void CallDesk::error(std::uint32_t messageID, const Error& error) {
  reply([&](MessagePackWriter& writer) {
    writer.unsignedInteger(messageID);
    writer.dictionary(3);
    writer.string("domain");
    writer.string(error.domain);
    writer.string("code");
    writer.integer(error.code);
    writer.string("userInfo");
    writer.value(error.userInfo);
    writer.nil();
  });
}

bool CallDesk::takeReplies(std::string& sent) {
  Empty(sent);
  MutexLock lock(mutex_);
  std::swap(sent, replies_);
  wakeRequested_ = !sent.empty();
  return wakeRequested_;
}

void CallDesk::refuseReplies() {
  MutexLock lock(mutex_);
  refused_ = true;
  replies_ = std::string();
  repliesHeld_ = 0;
}

void CallDesk::begin(std::size_t bytes) {
  callsBegun_.fetch_add(1);
  calls_.fetch_add(1);
  bytes_.fetch_add(bytes);
}

void CallDesk::carriedOut() {
  calls_.fetch_sub(1);
  wakeIfHalfIsDone();
}

void CallDesk::done(std::size_t bytes) {
  callsDone_.fetch_add(1);
  bytes_.fetch_sub(bytes);
  wakeIfHalfIsDone();
}

void CallDesk::wakeIfHalfIsDone() {
  if (waiting_ && halfIsDone() && waiting_.exchange(false)) wake_();
}

bool CallDesk::mustWaitForRoom() {
  if (!waiting_ && !isFull()) {
    if (turnIsUsedUp_) adaptTurn();
    return false;
  }
  if (calls_ >= turn_ && !std::exchange(turnIsUsedUp_, true)) {
    usedUpAt_ = std::chrono::steady_clock::now();
  }
  // Said before looking once more: a call that is done in between either is seen here or sees it.
  waiting_ = true;
  if (!halfIsDone()) return true;
  waiting_ = false;
  if (turnIsUsedUp_) adaptTurn();
  return false;
}

void CallDesk::adaptTurn() {
  turnIsUsedUp_ = false;
  const auto took = std::chrono::steady_clock::now() - usedUpAt_;
  const std::size_t turn = turn_.load(std::memory_order_relaxed);
  if (took > kSlow) {
    turn_ = std::max<std::size_t>(turn / 2, 1);
  } else if (took < kFast) {
    turn_ = std::min(turn * 2, callsLimit_);
  }
}

bool CallDesk::isFull() const {
  return calls_ >= turn_ || bytes_ >= bytesLimit_ || isFullBehind();
}

bool CallDesk::isFullBehind() const {
  return behind() >= excused_ + kMostBehind;
}

bool CallDesk::halfIsDone() const {
  return calls_ <= turn_ / 2 && bytes_ <= bytesLimit_ / 2 && behind() <= excused_ + kMostBehind / 2;
}

Call::Call(std::shared_ptr<CallDesk> desk, std::optional<std::uint32_t> messageID,
           std::size_t bytes)
    : desk_(std::move(desk)),
      bytes_(bytes),
      messageID_(messageID.value_or(0)),
      answered_(!messageID.has_value()) {}

void Call::result(Value value) {
  if (isFirstAnswer()) desk_->result(messageID_, value);
}

void Call::error(const Error& error) {
  if (isFirstAnswer()) desk_->error(messageID_, error);
}

}  // namespace quarvel
