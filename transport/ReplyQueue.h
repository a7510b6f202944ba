#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "base/Mutex.h"
#include "platform/Reply.h"
#include "queues/CallTracker.h"
#include "system/Configuration.h"

namespace quarvel {

/// What a connection shares with the calls that it has taken in: the replies they give and the
/// count of those still being worked on. Owned by the connection and its calls, so it outlives a
/// connection whose calls are kept for a late reply; it then holds no memory worth mentioning.
///
/// Any thread, except where the I/O thread is named.
class ReplyQueue {
 public:
  /// `wake` brings the I/O thread to the connection, from any thread: replies lie here, or there is
  /// room for calls again. Called without a lock held, once for all the replies of a batch.
  ReplyQueue(const Configuration::Limits& limits, std::function<void()> wake);

  // Replies.

  void result(std::uint32_t messageID, const Value& value);
  void error(std::uint32_t messageID, const Error& error);
  /// I/O thread. Exchanges `sent`, all of which has been written, for the replies given since the
  /// last time; false when there are none, and the next reply will wake.
  bool takeReplies(std::string& sent);
  /// I/O thread. So many bytes have been written.
  void repliesWritten(std::size_t bytes) { repliesHeld_ -= bytes; }
  /// Bytes given and not yet written.
  [[nodiscard]] std::size_t repliesHeld() const {
    return repliesHeld_.load(std::memory_order_relaxed);
  }
  /// The client will read no more: replies vanish from now on.
  void refuseReplies();

  // Calls being worked on.

  /// I/O thread. A call of so many bytes is taken in.
  void begin(std::size_t bytes);
  /// What it brought to the queue of all clients has run for so long.
  void ran(std::chrono::nanoseconds time);
  /// It has been carried out, though work that came of it may go on.
  void carriedOut();
  /// All work that came of it is done.
  void done(std::size_t bytes);
  /// I/O thread. Whether no further call may be taken in; if so, `wake` is called when half of the
  /// turn, of what may be behind, or of the limit on bytes, is done.
  [[nodiscard]] bool mustWaitForRoom();
  /// I/O thread. Whether `mustWaitForRoom` was true and nothing has woken since.
  [[nodiscard]] bool isWaiting() const { return waiting_; }
  /// I/O thread, while it waits. When the number of calls done stays the same for long, those
  /// behind wait for something slow, and the client shall not.
  [[nodiscard]] std::size_t callsDone() const { return callsDone_; }
  void excuseThoseBehind();

 private:
  template <class Encode>
  void reply(Encode encode);
  void wakeIfHalfIsDone();
  [[nodiscard]] bool isFull() const;
  [[nodiscard]] bool halfIsDone() const;
  [[nodiscard]] bool isFullBehind() const { return behind() >= excused_ + behindLimit_; }
  [[nodiscard]] std::size_t behind() const { return callsBegun_ - callsDone_ - calls_; }
  void adaptBehind();

  // Constant after construction.
  const std::size_t replyBytesLimit_;
  const std::size_t callsLimit_;
  const std::size_t bytesLimit_;
  const std::function<void()> wake_;

  Mutex mutex_;
  std::string replies_ QUARVEL_GUARDED_BY(mutex_);
  bool wakeRequested_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool refused_ QUARVEL_GUARDED_BY(mutex_) = false;
  std::atomic<std::size_t> repliesHeld_{0};

  std::atomic<std::size_t> calls_{0};  // not carried out
  std::atomic<std::size_t> bytes_{0};  // of calls of which anything is still to be done
  std::atomic<bool> waiting_{false};   // the I/O thread wants to hear of room

  // How many calls may be ahead of other clients' ones: as many as take a tenth of a millisecond,
  // by what the last ones took.
  std::atomic<std::int64_t> callTime_;  // in nanoseconds
  std::atomic<std::size_t> turn_;
  // Calls that have been carried out, and so answered, but of which something is still to be done:
  // as many as are done in a few milliseconds, so that what is answered is soon in the store, and
  // what comes of it is in nobody's way. Those that wait for something slow, such as a session's
  // backends, are excused.
  std::atomic<std::size_t> behindLimit_;
  std::atomic<std::size_t> callsBegun_{0};
  std::atomic<std::size_t> callsDone_{0};
  std::atomic<std::size_t> excused_{0};

  std::optional<std::chrono::steady_clock::time_point> fullBehindSince_;  // the I/O thread's
};

/// One call: where its reply goes and what stands for the work that came of it.
class Call final : public ReplySink, public CallTracker {
 public:
  /// `messageID`: none for a notification, whose reply is discarded.
  Call(std::shared_ptr<ReplyQueue> desk, std::optional<std::uint32_t> messageID, std::size_t bytes);

  void result(Value value) override;
  void error(const Error& error) override;
  [[nodiscard]] std::size_t bytes() const override { return bytes_; }

 protected:
  void ran(std::chrono::nanoseconds time) override { desk_->ran(time); }
  void carriedOut() override { desk_->carriedOut(); }
  void completed() override { desk_->done(bytes_); }

 private:
  [[nodiscard]] bool isFirstAnswer() {
    return !answered_.exchange(true, std::memory_order_relaxed);
  }

  // Constant after construction.
  const std::shared_ptr<ReplyQueue> desk_;
  const std::size_t bytes_;
  const std::uint32_t messageID_;

  std::atomic<bool> answered_;
};

}  // namespace quarvel
