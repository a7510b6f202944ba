#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>

#include "platform/Reply.h"
#include "queues/CallTracker.h"
#include "quotas/FlowControl.h"
#include "system/Configuration.h"
#include "transport/ReplyQueue.h"

namespace quarvel {

/// Joins a connection and its calls: replies and progress of the calls go to the connection.
/// Owner: the connection and each call, so it may outlive the connection.
struct CallChannel {
  /// I/O thread. `wakeConnection` becomes `wake`; it may outlive the connection.
  CallChannel(const Configuration::Limits& limits, std::function<void()> wakeConnection)
      : wake(std::move(wakeConnection)),
        replies(limits.replyBytes),
        flow(limits.queuedCalls, limits.queuedBytes) {}

  /// Any thread, without a lock held: has the I/O thread look at replies and at the room for calls.
  const std::function<void()> wake;
  /// Calls add replies, the connection writes them.
  ReplyQueue replies;
  /// Calls report progress, the connection asks whether it may take in more.
  CallFlow flow;
};

/// One call: sends its reply, and tells the connection how far its work is. Lock-free but for the
/// reply queue.
/// Owner: its reply and every block that it caused, until the last of them has gone. Any thread.
class Call final : public ReplySink, public CallTracker {
 public:
  /// `messageID`: none for a notification, whose reply is discarded. `bytes`: the size of its
  /// frame, which counts until the call has completed.
  Call(std::shared_ptr<CallChannel> channel, std::optional<std::uint32_t> messageID,
       std::size_t bytes)
      : channel_(std::move(channel)),
        bytes_(bytes),
        messageID_(messageID.value_or(0)),
        answered_(!messageID.has_value()) {}

  // Any thread. The first answer is sent, later ones are discarded.
  void result(Value value) override {
    if (isFirstAnswer()) wakeIf(channel_->replies.addResult(messageID_, value));
  }
  void error(const Error& error) override {
    if (isFirstAnswer()) wakeIf(channel_->replies.addError(messageID_, error));
  }
  /// The size of the frame.
  [[nodiscard]] std::size_t bytes() const override { return bytes_; }

 protected:
  void blockRan(std::chrono::nanoseconds time) override { channel_->flow.blockRan(time); }
  void callExecuted() override { wakeIf(channel_->flow.callExecuted()); }
  void callCompleted() override { wakeIf(channel_->flow.callCompleted(bytes_)); }

 private:
  /// Whether this answer is to be sent. Any thread; true once, for a notification never.
  [[nodiscard]] bool isFirstAnswer() {
    return !answered_.exchange(true, std::memory_order_relaxed);
  }
  void wakeIf(bool needed) {
    if (needed) channel_->wake();
  }

  // Constant after construction.
  const std::shared_ptr<CallChannel> channel_;
  const std::size_t bytes_;
  const std::uint32_t messageID_;  // of a request

  std::atomic<bool> answered_;  // or a notification, which has no answer
};

}  // namespace quarvel
