#pragma once

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <optional>

namespace quarvel {

// Flow control: each class below decides one thing about how much work the service takes in at
// once. Their owners count events, pass the time in and act on the answer.

/// The constants of every decision. Limits that a user can configure are passed in instead.
namespace flow {

// CallFlow.

/// Queue time that one client's calls may take before the calls of others: 0.1 ms keeps a client's
/// wait below 1 ms while ten others send without end.
inline constexpr std::chrono::nanoseconds kCallTurn = std::chrono::microseconds{100};
/// Calls in the first turn, while the time of a call is unknown: assumes 6 µs each.
inline constexpr std::size_t kFirstCallTurn = 16;
/// The newest call's share in the learned time is 1/8: about eight light calls in a row lengthen
/// the turn again.
inline constexpr std::int64_t kCallTimeShare = 8;
/// The learned time is at least 1/4 of the newest call's: one heavy call shortens the turn at once.
inline constexpr std::int64_t kHeavyCallShare = 4;
/// Unstored calls at most: the store commits as many rows in a few milliseconds.
inline constexpr std::size_t kUnstoredCalls = 128;
/// Half of the unstored calls took longer than this to store: the limit halves. 2 ms is a fifth of
/// the 10 ms within which an answered call is stored.
inline constexpr std::chrono::microseconds kSlowToStore{2000};
/// They took less than this: the limit doubles. A quarter of `kSlowToStore`, so that the limit does
/// not swing.
inline constexpr std::chrono::microseconds kFastToStore{500};
/// No call completed for this long: the unstored calls wait for something slow (a backend), not for
/// the store, which commits far more often.
inline constexpr std::chrono::milliseconds kExemptAfter{50};

// ReadTurn.

/// Decoding time for one client's calls before other clients are read. Twice `kCallTurn`: calls
/// with work for a queue stop at that, calls that are answered at once (errors) stop here.
inline constexpr std::chrono::microseconds kReadTurn{200};
/// Calls between two looks at the clock, so that 16 calls share the cost of a look.
inline constexpr unsigned kCallsPerClockRead = 16;

// AcceptRateLimit, and its users in the listener.

/// Clients accepted in a burst: a device's start, when every client connects at once.
inline constexpr int kAcceptBurst = 512;
/// Sustained, 4,000 clients a second: a new client costs a few hundred microseconds (process
/// information, log lines, a row).
inline constexpr std::chrono::microseconds kAcceptInterval{250};
/// Clients accepted before connected clients are served again: 1 ms of work.
inline constexpr int kAcceptsPerTurn = 4;
/// Time until accept() is tried again after it failed: descriptors may be freed by other processes,
/// without any event here.
inline constexpr std::chrono::seconds kAcceptRetry{1};

// ChurnLimit.

/// Connections whose begin or end is still being worked on: the work of eight takes a fraction of a
/// millisecond.
inline constexpr std::size_t kConnectionChanges = 8;

// StoreDepth.

/// Commit time of the rows that may be queued. With the time to reach the queue, half of the 10 ms
/// within which an answered call is stored.
inline constexpr std::chrono::nanoseconds kCommitTime = std::chrono::milliseconds{4};
/// Rows in the smallest transaction that is learned from; in a smaller one the fixed cost
/// dominates. Also the smallest depth.
inline constexpr std::size_t kFewestRows = 128;
/// The newest commit's share in the learned time is 1/4: about four commits decide.
inline constexpr std::int64_t kRowTimeShare = 4;

}  // namespace flow

using FlowInstant = std::chrono::steady_clock::time_point;
/// Reads the monotonic clock. Passed instead of the time where the time is rarely needed, so that a
/// call does not pay for a look at the clock.
using FlowClock = FlowInstant (*)();

/// Limits the calls of one connection that are in flight: executing ones by the turn, learned from
/// the time of the last calls; executed ones whose rows are not stored yet ("unstored") by the time
/// the store takes for them; both by their bytes. Past a limit the connection is not read. It is
/// read again when half of each limit is free, so that it is woken once a batch.
///
/// Owner: `CallChannel`, so it lives as long as the connection and its last call.
/// Threads: calls report from any thread, the I/O thread asks; atomics, no lock.
class CallFlow {
 public:
  /// `calls` bounds the learned turn; `bytes` bounds the calls of which any work is left.
  CallFlow(std::size_t calls, std::size_t bytes);

  // Progress of a call, in this order. `true` means: wake the connection, which waits and now has
  // room. A wait is woken once.

  /// I/O thread.
  void callBegun(std::size_t bytes);
  /// Any thread. One of the call's own blocks took `time`.
  void blockRan(std::chrono::nanoseconds time);
  /// Any thread. The call's own blocks have run; further work may follow.
  [[nodiscard]] bool callExecuted();
  /// Any thread. All work is done, rows stored included.
  [[nodiscard]] bool callCompleted(std::size_t bytes);

  // Decisions. I/O thread.

  /// Whether no further call may be taken in until the connection is woken.
  [[nodiscard]] bool mustWait(FlowClock clock);
  /// Whether `mustWait` was true and no wake followed yet.
  [[nodiscard]] bool isWaiting() const { return waiting_; }
  [[nodiscard]] std::size_t completedCalls() const { return completed_; }
  /// Called `flow::kExemptAfter` after `completedCalls` was `completedBefore`. When no call
  /// completed meanwhile, the calls that are unstored now no longer count against the limit: they
  /// cost the client bytes, not calls.
  void exemptSlowCalls(std::size_t completedBefore);

 private:
  [[nodiscard]] bool wakeIfHalfIsFree();
  [[nodiscard]] bool isFull() const;
  [[nodiscard]] bool halfIsFree() const;
  [[nodiscard]] std::size_t unstored() const { return begun_ - completed_ - executing_; }
  [[nodiscard]] bool isFullOfUnstored() const { return unstored() >= exempt_ + unstoredLimit_; }
  void adaptUnstoredLimit(std::chrono::nanoseconds took);

  // Constant after construction.
  const std::size_t callsLimit_;
  const std::size_t bytesLimit_;

  // Any thread.
  std::atomic<std::size_t> begun_{0};
  std::atomic<std::size_t> executing_{0};
  std::atomic<std::size_t> completed_{0};
  std::atomic<std::size_t> bytes_{0};       // of calls that are not completed
  std::atomic<bool> waiting_{false};        // the I/O thread is to be woken
  std::atomic<std::int64_t> callTime_;      // learned, in nanoseconds
  std::atomic<std::size_t> turn_;           // calls of `callTime_` in `flow::kCallTurn`
  std::atomic<std::size_t> unstoredLimit_;  // calls
  std::atomic<std::size_t> exempt_{0};      // calls added to `unstoredLimit_`

  // The I/O thread's.
  std::optional<FlowInstant> fullOfUnstoredSince_;
};

/// Bounds the time for which one client's calls are decoded before the other clients are read.
/// Owner: the stack of the I/O thread, for one turn.
class ReadTurn {
 public:
  explicit ReadTurn(FlowInstant now) : end_(now + flow::kReadTurn) {}
  /// Counts a call. Whether the turn is over.
  [[nodiscard]] bool isOverAfterCall(FlowClock clock) {
    return ++calls_ % flow::kCallsPerClockRead == 0 && clock() >= end_;
  }

 private:
  const FlowInstant end_;
  unsigned calls_ = 0;
};

/// Token bucket for accept(), so that clients that connect and disconnect without pause leave
/// processor time to others. Owner: the listener. I/O thread only.
class AcceptRateLimit {
 public:
  [[nodiscard]] bool allowsOne(FlowInstant now) const { return nextToken_ <= now; }
  void accepted(FlowInstant now) {
    nextToken_ = std::max(nextToken_, now - flow::kAcceptInterval * flow::kAcceptBurst) +
                 flow::kAcceptInterval;
  }
  /// When `flow::kAcceptsPerTurn` clients may be accepted again.
  [[nodiscard]] FlowInstant nextTurn() const {
    return nextToken_ + flow::kAcceptInterval * flow::kAcceptsPerTurn;
  }

 private:
  FlowInstant nextToken_;
};

/// Bounds the connections whose begin or end is still being worked on. Their blocks go to the queue
/// on which every client's calls run, so past the bound no client is accepted until half of the
/// work is done. Owner: `ConnectionContext`. The I/O thread asks; changes end on any thread.
class ChurnLimit {
 public:
  /// I/O thread.
  void changeBegun() { ++changes_; }
  /// Any thread. True: clients may be accepted again, wake the listener.
  [[nodiscard]] bool changeEnded() {
    return --changes_ <= flow::kConnectionChanges / 2 && waiting_.exchange(false);
  }
  /// I/O thread. Whether no client may be accepted; `changeEnded` will then ask for a wake.
  [[nodiscard]] bool mustWait();

 private:
  std::atomic<std::size_t> changes_{0};
  std::atomic<bool> waiting_{false};
};

/// Learns how many rows the store commits in `flow::kCommitTime`, which bounds its queue: an
/// accepted row is then safe from the end of the process within milliseconds, on a slow medium too.
/// Owner: `StoreQueue`, whose lock guards it.
class StoreDepth {
 public:
  /// `maximumRows`: the configured bound, also the depth before the first commit.
  explicit StoreDepth(std::size_t maximumRows)
      : maximumRows_(maximumRows), learnedRows_(maximumRows) {}

  /// The rows that may be queued.
  [[nodiscard]] std::size_t rows() const { return std::min(learnedRows_, maximumRows_); }
  /// A transaction of `rows` took `time`.
  void committed(std::size_t rows, std::chrono::nanoseconds time);

 private:
  const std::size_t maximumRows_;
  std::int64_t rowTime_ = 0;  // of a commit, in nanoseconds; 0: unknown
  std::size_t learnedRows_;
};

}  // namespace quarvel
