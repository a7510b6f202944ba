#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <string>

#include "base/Error.h"
#include "base/Mutex.h"
#include "base/Value.h"

namespace quarvel {

/// Replies of one connection's calls, encoded, until the I/O thread has written them.
/// Owner: `CallChannel`, so it outlives a connection whose calls are kept for a late reply; it then
/// refuses replies and holds no memory for them.
/// Threads: calls add replies from any thread; the rest is the I/O thread's.
class ReplyQueue {
 public:
  /// `maximumBytes`: with so many held, the client counts as one that does not read.
  explicit ReplyQueue(std::size_t maximumBytes) : maximumBytes_(maximumBytes) {}

  // Any thread. True: wake the connection. Once for all replies until the next `take`, and once
  // more when `maximumBytes` is reached, so that the stall time-out starts.

  /// Encodes the response `[1, messageID, nil, value]`.
  [[nodiscard]] bool addResult(std::uint32_t messageID, const Value& value)
      QUARVEL_EXCLUDES(mutex_);
  /// Encodes the response `[1, messageID, error, nil]`.
  [[nodiscard]] bool addError(std::uint32_t messageID, const Error& error) QUARVEL_EXCLUDES(mutex_);
  /// Bytes added and not yet written.
  [[nodiscard]] std::size_t heldBytes() const { return heldBytes_.load(std::memory_order_relaxed); }
  /// Whether the client counts as one that does not read, and is held back.
  [[nodiscard]] bool holdsMaximum() const { return heldBytes() >= maximumBytes_; }

  // I/O thread.

  /// Exchanges `sent`, all of which has been written, for the replies added since the last call.
  /// False when there are none; the next reply then asks for a wake.
  [[nodiscard]] bool take(std::string& sent) QUARVEL_EXCLUDES(mutex_);
  /// The socket has taken `bytes` of what the last `take` handed out.
  void written(std::size_t bytes) { heldBytes_ -= bytes; }
  /// The client will read no more: held and further replies are discarded.
  void refuse() QUARVEL_EXCLUDES(mutex_);

 private:
  /// Encodes with a writer on `replies_`. True: wake the connection.
  template <class Encode>
  bool add(Encode encode) QUARVEL_EXCLUDES(mutex_);

  const std::size_t maximumBytes_;
  std::atomic<std::size_t> heldBytes_{0};

  Mutex mutex_;
  std::string replies_ QUARVEL_GUARDED_BY(mutex_);
  bool wakeRequested_ QUARVEL_GUARDED_BY(mutex_) = false;  // since the last `take`
  bool refused_ QUARVEL_GUARDED_BY(mutex_) = false;
};

}  // namespace quarvel
