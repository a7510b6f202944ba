#include "transport/ReplyQueue.h"

#include <algorithm>
#include <utility>

#include "base/MessagePack.h"

namespace quarvel {

namespace {

constexpr std::int64_t kResponse = 1;

/// How long the calls of one client may keep those of others waiting.
constexpr std::chrono::nanoseconds kTurn = std::chrono::microseconds{100};

/// What the store takes in a few milliseconds, where nothing is in its way.
constexpr std::size_t kMostBehind = 128;
// When half of those that may be behind take longer than this, fewer may be; when they take less,
// more.
constexpr std::chrono::microseconds kSlowBehind{2000};
constexpr std::chrono::microseconds kFastBehind{500};

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

ReplyQueue::ReplyQueue(const Configuration::Limits& limits, std::function<void()> wake)
    : replyBytesLimit_(limits.replyBytes),
      callsLimit_(limits.queuedCalls),
      bytesLimit_(limits.queuedBytes),
      wake_(std::move(wake)),
      callTime_(kTurn.count() / static_cast<std::int64_t>(limits.firstTurn)),
      turn_(std::min(limits.firstTurn, limits.queuedCalls)),
      behindLimit_(kMostBehind) {}

template <class Encode>
void ReplyQueue::reply(Encode encode) {
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

void ReplyQueue::result(std::uint32_t messageID, const Value& value) {
  reply([&](MessagePackWriter& writer) {
    writer.unsignedInteger(messageID);
    writer.nil();
    writer.value(value);
  });
}

void ReplyQueue::error(std::uint32_t messageID, const Error& error) {
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

bool ReplyQueue::takeReplies(std::string& sent) {
  Empty(sent);
  MutexLock lock(mutex_);
  std::swap(sent, replies_);
  wakeRequested_ = !sent.empty();
  return wakeRequested_;
}

void ReplyQueue::refuseReplies() {
  MutexLock lock(mutex_);
  refused_ = true;
  replies_ = std::string();
  repliesHeld_ = 0;
}

void ReplyQueue::begin(std::size_t bytes) {
  callsBegun_.fetch_add(1);
  calls_.fetch_add(1);
  bytes_.fetch_add(bytes);
}

void ReplyQueue::carriedOut() {
  calls_.fetch_sub(1);
  wakeIfHalfIsDone();
}

void ReplyQueue::done(std::size_t bytes) {
  callsDone_.fetch_add(1);
  bytes_.fetch_sub(bytes);
  wakeIfHalfIsDone();
}

void ReplyQueue::wakeIfHalfIsDone() {
  if (waiting_ && halfIsDone() && waiting_.exchange(false)) wake_();
}

void ReplyQueue::ran(std::chrono::nanoseconds time) {
  // Heavy ones count at once, light ones in the long run.
  const std::int64_t known = callTime_.load(std::memory_order_relaxed);
  const std::int64_t callTime =
      std::max({known + (time.count() - known) / 8, time.count() / 4, std::int64_t{1}});
  callTime_.store(callTime, std::memory_order_relaxed);
  turn_ =
      std::clamp(static_cast<std::size_t>(kTurn.count() / callTime), std::size_t{1}, callsLimit_);
}

bool ReplyQueue::mustWaitForRoom() {
  if (waiting_ || isFull()) {
    if (isFullBehind() && !fullBehindSince_) fullBehindSince_ = std::chrono::steady_clock::now();
    // Said before looking once more: a call that is done in between either is seen here or sees it.
    waiting_ = true;
    if (!halfIsDone()) return true;
    waiting_ = false;
  }
  if (fullBehindSince_) adaptBehind();
  return false;
}

void ReplyQueue::adaptBehind() {
  const auto took =
      std::chrono::steady_clock::now() - *std::exchange(fullBehindSince_, std::nullopt);
  if (took > kSlowBehind) {
    behindLimit_ = std::max<std::size_t>(behindLimit_ / 2, 1);
  } else if (took < kFastBehind) {
    behindLimit_ = std::min(behindLimit_ * 2, kMostBehind);
  }
}

void ReplyQueue::excuseThoseBehind() {
  excused_ = behind();
  fullBehindSince_.reset();
}

bool ReplyQueue::isFull() const {
  return calls_ >= turn_ || bytes_ >= bytesLimit_ || isFullBehind();
}

bool ReplyQueue::halfIsDone() const {
  return calls_ <= turn_ / 2 && bytes_ <= bytesLimit_ / 2 &&
         behind() <= excused_ + behindLimit_ / 2;
}

Call::Call(std::shared_ptr<ReplyQueue> desk, std::optional<std::uint32_t> messageID,
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
