#include "transport/ReplyQueue.h"

#include <utility>

#include "base/MessagePack.h"

namespace quarvel {

namespace {

constexpr std::int64_t kResponse = 1;

/// A buffer that a burst has grown beyond 64 KiB is freed, so that an idle connection stays small.
constexpr std::size_t kKeptCapacity = std::size_t{64} * 1024;

void Empty(std::string& buffer) {
  if (buffer.capacity() > kKeptCapacity) {
    buffer = std::string();
  } else {
    buffer.clear();
  }
}

}  // namespace

template <class Encode>
bool ReplyQueue::add(Encode encode) {
  MutexLock lock(mutex_);
  if (refused_) return false;
  const std::size_t before = replies_.size();
  MessagePackWriter writer(replies_);
  writer.list(4);
  writer.integer(kResponse);
  encode(writer);
  const std::size_t added = replies_.size() - before;
  const std::size_t held = heldBytes_.fetch_add(added);
  const bool reachesMaximum = held < maximumBytes_ && held + added >= maximumBytes_;
  return !std::exchange(wakeRequested_, true) || reachesMaximum;
}

bool ReplyQueue::addResult(std::uint32_t messageID, const Value& value) {
  return add([&](MessagePackWriter& writer) {
    writer.unsignedInteger(messageID);
    writer.nil();
    writer.value(value);
  });
}

bool ReplyQueue::addError(std::uint32_t messageID, const Error& error) {
  return add([&](MessagePackWriter& writer) {
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

bool ReplyQueue::take(std::string& sent) {
  Empty(sent);
  MutexLock lock(mutex_);
  std::swap(sent, replies_);
  wakeRequested_ = !sent.empty();
  return wakeRequested_;
}

void ReplyQueue::refuse() {
  MutexLock lock(mutex_);
  refused_ = true;
  replies_ = std::string();
  heldBytes_ = 0;
}

}  // namespace quarvel
