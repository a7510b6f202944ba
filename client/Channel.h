#pragma once

#include <atomic>
#include <chrono>
#include <concepts>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <random>
#include <string>
#include <string_view>
#include <thread>
#include <unordered_map>
#include <utility>
#include <vector>

#include <sys/types.h>

#include <quarvel/client.hpp>

#include "base/MessagePack.h"
#include "base/Mutex.h"
#include "client/Poller.h"
#include "client/Replies.h"
#include "client/Sessions.h"

namespace quarvel {

/// The connection behind a client: frames calls, matches responses with pending calls, and
/// reconnects where the options ask for it. Owned by its client, its thread and its real-time
/// reporters; lives until the last of them has gone.
///
/// Threads: reading, replies and timers happen in `step`, on one thread at a time, the driver. The
/// driver is the connection's own thread, or the thread that is in `dispatch`. Callers write their
/// own calls as long as the socket takes them; the driver writes the rest.
class __attribute__((visibility("hidden"))) Client::Channel
    : public std::enable_shared_from_this<Client::Channel> {
 public:
  using Time = Poller::Time;

  /// Work that the driver repeats as long as the work's owner keeps it.
  class Periodic {
   public:
    virtual ~Periodic() = default;
    /// Runs on the driver. Returns the time of the next run; none: no further run.
    virtual std::optional<Time> run() = 0;
  };

  /// Connects and starts the driver. Errors: `Code::unreachable`, also when the process can have no
  /// further descriptor or thread.
  [[nodiscard]] static Result<std::shared_ptr<Channel>> open(Options options);
  /// For `open`, which then begins. `path` is the socket's.
  Channel(Options options, std::string path);
  /// The connection is closed: `close` was called, or `begin` has failed.
  ~Channel();

  /// The result of sending a call.
  struct Sent {
    /// `none`: sent or gathered. Else the error that the reply gets, if there is one.
    Code code = Code::none;
    /// The number under which the reply is pending; none for a notification or a refused call.
    std::optional<std::uint32_t> call;
  };
  /// Sends one call; without a `reply` it is a notification. Waits while the service holds this
  /// client back, if the connection has its own thread and this is another.
  template <class Request, class T>
  Sent send(const Request& request, Reply<T> reply) QUARVEL_EXCLUDES(mutex_);

  /// Drops the reply of a pending call.
  void forget(std::uint32_t call) QUARVEL_EXCLUDES(mutex_);

  // Between the two, calls gather.
  void beginBatch() QUARVEL_EXCLUDES(mutex_);
  void endBatch() QUARVEL_EXCLUDES(mutex_);
  /// Sends the gathered calls, despite open batches.
  void flush() QUARVEL_EXCLUDES(mutex_);

  /// Has the driver run `work` at `time`, and again at each time that a run returns.
  void schedule(Time time, std::weak_ptr<Periodic> work) QUARVEL_EXCLUDES(mutex_);

  /// False from the loss of the connection until it is made again.
  [[nodiscard]] bool connected() const QUARVEL_EXCLUDES(mutex_);
  /// Whether the connection is lost and will be made again.
  [[nodiscard]] bool reconnecting() const QUARVEL_EXCLUDES(mutex_);
  /// Readable when `dispatch` has work; -1 when the connection has its own thread.
  [[nodiscard]] int descriptor() const { return ownThread() ? -1 : poller_.descriptor(); }
  /// Whether this thread is the driver, that is, whether the caller is a reply.
  [[nodiscard]] bool onDriver() const { return driver_.load() == std::this_thread::get_id(); }

  /// One step of the driver on this thread. See `Client::dispatch`.
  Code dispatch(std::optional<Time> deadline) QUARVEL_EXCLUDES(mutex_);
  /// Drives until `done()`, or until the deadline has passed. False when another thread drives.
  template <std::predicate Done>
  bool driveUntil(Done&& done, std::optional<Time> deadline) QUARVEL_EXCLUDES(mutex_);

  /// Sends the gathered calls, closes the connection and waits until every pending call is
  /// answered. On the driver it returns at once, and the driver does this after the reply.
  void close() QUARVEL_EXCLUDES(mutex_);

  /// None for no wait limit, or one of more than a year.
  [[nodiscard]] static std::optional<Time> DeadlineAfter(
      std::optional<std::chrono::milliseconds> wait);

 private:
  /// Gathered bytes at which a batch is sent early, and at which senders wait for the writer.
  static constexpr std::size_t kGatheredBytes = 65'536;
  /// Writes after which a sender leaves other threads' calls to the driver, and reads after which
  /// the driver looks at its timers.
  static constexpr int kRounds = 16;
  /// The service's own bound is below this; it keeps a broken peer from taking all memory.
  static constexpr std::size_t kReplyBytes = 67'108'864;

  /// `down`: will be made again; `lost`: will not.
  enum class Link : std::uint8_t { up, down, lost };
  /// `failed`: the connection is broken, which the driver notices when it reads.
  enum class Written : std::uint8_t { all, some, failed };

  /// A call that the service has not answered yet.
  struct Pending {
    AnyReply reply;
    SessionCall::Kind kind = SessionCall::Kind::none;
    ReporterID session = 0;
  };
  /// A call that this side answers with an error.
  struct Refused {
    AnyReply reply;
    Code code = Code::none;
  };
  /// Work of the driver that is due at `time`; dropped when the work no longer exists.
  struct Scheduled {
    Time time;
    std::weak_ptr<Periodic> work;
  };

  [[nodiscard]] bool ownThread() const { return options_.driver == Driver::ownThread; }
  /// A socket that does not block, connected to the service's at `path`. Errors:
  /// `Code::unreachable`; also, unless `mayWait`, while the queue of new connections is full.
  [[nodiscard]] static Result<int> connectTo(const std::string& path, bool mayWait);
  /// Takes the connected socket over and starts the driver's thread where there is one.
  [[nodiscard]] Outcome begin(int socket) QUARVEL_EXCLUDES(mutex_);

  // Calls, on the caller's thread.

  /// Numbers a call and records its pending reply, or refuses it.
  [[nodiscard]] Sent registerCall(AnyReply&& reply, const SessionCall& session)
      QUARVEL_REQUIRES(mutex_);
  /// Whether the call may be sent now. While the link is down, records the call's lasting effect; a
  /// start's `reply` may be kept with its session.
  [[nodiscard]] Code checkCall(const SessionCall& session, AnyReply& reply)
      QUARVEL_REQUIRES(mutex_);
  /// A number that no pending call has; numbers come again after 2^32 calls.
  [[nodiscard]] std::uint32_t nextNumber() QUARVEL_REQUIRES(mutex_);
  /// Has the driver deliver an error.
  void refuse(AnyReply&& reply, Code code) QUARVEL_REQUIRES(mutex_);
  /// Appends a call's bytes to the gathered ones; a notification has no number.
  template <class Request>
  void frame(const Request& request, std::optional<std::uint32_t> call) QUARVEL_REQUIRES(mutex_);

  // Output, on the caller's thread or the driver's.

  /// Writes the gathered calls unless a batch, another writer or the driver will; then waits while
  /// too many bytes have gathered, where that is allowed.
  void sendIfDue() QUARVEL_REQUIRES(mutex_);
  /// Whether bytes of calls are gathered or partly written.
  [[nodiscard]] bool hasOutput() const QUARVEL_REQUIRES(mutex_);
  /// Writes gathered calls, other threads' calls too, for at most `kRounds` rounds. Releases the
  /// mutex during each system call.
  void write(bool mayWait) QUARVEL_REQUIRES(mutex_);
  /// Writes `sending_`; `some`: the socket is full and `mayWait` is false.
  [[nodiscard]] Written writeSending(int socket, bool mayWait);
  /// Has the driver wake when the socket takes bytes again.
  void watchOutput(bool wanted) QUARVEL_REQUIRES(mutex_);

  /// Whether the driver must write: batches do not hold the bytes back.
  [[nodiscard]] bool hasOutputDue() const QUARVEL_REQUIRES(mutex_);

  // The driver.

  /// The body of the connection's own thread.
  void run() QUARVEL_EXCLUDES(mutex_);
  /// Waits for events until `deadline` and handles them: input, timers, refusals, output.
  void step(std::optional<Time> deadline) QUARVEL_EXCLUDES(mutex_);
  /// Whether `close` was called.
  [[nodiscard]] bool closing() const QUARVEL_EXCLUDES(mutex_);
  /// Sends the gathered calls, ends the connection and answers every pending call.
  void finish() QUARVEL_EXCLUDES(mutex_);
  /// Writes as much as the socket takes; true when nothing is left to be sent.
  [[nodiscard]] bool flushed() QUARVEL_EXCLUDES(mutex_);
  /// In a child process: closes the copies of the descriptors and does nothing else.
  void abandon();

  /// Reads for at most `kRounds` rounds and delivers the replies; handles a loss.
  void receiveReplies() QUARVEL_EXCLUDES(mutex_);
  // Both return the reason when the connection is lost; `more`: bytes may be left in the socket.
  [[nodiscard]] std::optional<std::string> receive(bool& more) QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] std::optional<std::string> deliverReplies() QUARVEL_EXCLUDES(mutex_);
  /// False when the bytes are no response. A response without a pending call is ignored: its caller
  /// has stopped waiting.
  [[nodiscard]] bool deliverReply(PayloadValue response) QUARVEL_EXCLUDES(mutex_);
  /// Delivers the errors of `refused_`.
  void deliverRefusals() QUARVEL_EXCLUDES(mutex_);

  // Loss and reconnection, on the driver.

  /// Closes the socket, refuses or keeps the pending replies, plans the first attempt, and reports
  /// the change.
  void handleLoss(const std::string& reason, bool forGood) QUARVEL_EXCLUDES(mutex_);
  /// Forgets the bytes not sent; returns the number of notifications among them.
  [[nodiscard]] std::size_t dropOutput() QUARVEL_REQUIRES(mutex_);
  /// Refuses the pending calls, or keeps their replies; returns the number refused.
  [[nodiscard]] std::size_t refusePending() QUARVEL_REQUIRES(mutex_);
  /// The wait before the next attempt, with its jitter; doubles the one after it.
  [[nodiscard]] std::chrono::milliseconds nextDelay();
  /// Makes one attempt; plans the next when it fails.
  void reconnect() QUARVEL_EXCLUDES(mutex_);
  /// Frames the calls that create the sessions anew; returns their number.
  [[nodiscard]] std::size_t restoreSessions() QUARVEL_REQUIRES(mutex_);
  /// Runs the work that is due, without the mutex.
  void runScheduled() QUARVEL_EXCLUDES(mutex_);
  /// Sets the poller's timer to the earliest work or attempt.
  void armTimer() QUARVEL_EXCLUDES(mutex_);

  // Constant after construction.
  const Options options_;
  const std::string path_;
  const pid_t process_;
  Poller poller_;
  std::thread thread_;

  std::atomic<std::thread::id> driver_{};  // changed under the mutex

  mutable Mutex mutex_;
  ConditionVariable room_;  // signalled when output was taken, the writer or the connection ended
  Link link_ QUARVEL_GUARDED_BY(mutex_) = Link::lost;
  int socket_ QUARVEL_GUARDED_BY(mutex_) = -1;  // closed only while `writing_` is false
  std::string gathered_ QUARVEL_GUARDED_BY(mutex_);
  bool writing_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool outputWatched_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool flushing_ QUARVEL_GUARDED_BY(mutex_) = false;  // gathered calls go out despite batches
  int batches_ QUARVEL_GUARDED_BY(mutex_) = 0;
  bool closing_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool finished_ QUARVEL_GUARDED_BY(mutex_) = false;
  std::uint32_t nextCall_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::unordered_map<std::uint32_t, Pending> pending_ QUARVEL_GUARDED_BY(mutex_);
  std::vector<Refused> refused_ QUARVEL_GUARDED_BY(mutex_);  // the driver delivers their errors
  Sessions sessions_ QUARVEL_GUARDED_BY(mutex_);             // kept only to be restored
  std::size_t unsent_ QUARVEL_GUARDED_BY(mutex_) = 0;  // lost notifications while the link is down
  std::vector<Scheduled> scheduled_ QUARVEL_GUARDED_BY(mutex_);

  // For the thread that has set `writing_`; it releases the mutex to write.
  std::string sending_;   // whole calls
  std::size_t sent_ = 0;  // bytes of `sending_`

  // For the driver alone.
  std::vector<char> received_;  // input; [begin_, end_) are not delivered yet
  std::size_t begin_ = 0;
  std::size_t end_ = 0;
  MessagePackScanner scanner_{kReplyBytes, MessagePackScanner::kDeepest};
  std::string lossReason_;             // for the error of refused calls
  Time connectedAt_{};                 // of the present connection
  std::optional<Time> reconnectAt_;    // of the next attempt, while the link is down
  std::chrono::milliseconds delay_{};  // of the next attempt, before its jitter
  std::minstd_rand random_;            // of the jitter
};

template <class Request, class T>
Client::Channel::Sent Client::Channel::send(const Request& request, Reply<T> reply) {
  AnyReply any;
  if (reply) any = std::move(reply);
  MutexLock lock(mutex_);
  const Sent sent = registerCall(std::move(any), request.session);
  if (sent.code != Code::none) return sent;
  frame(request, sent.call);
  sendIfDue();
  return sent;
}

template <class Request>
void Client::Channel::frame(const Request& request, std::optional<std::uint32_t> call) {
  enum : std::int64_t { request_ = 0, notification = 2 };
  MessagePackWriter writer(gathered_);
  writer.list(call ? 4 : 3);
  writer.integer(call ? request_ : notification);
  if (call) writer.unsignedInteger(*call);
  writer.string(request.operation);
  request.write(writer);
}

template <std::predicate Done>
bool Client::Channel::driveUntil(Done&& done, std::optional<Time> deadline) {
  while (!done()) {
    if (deadline && std::chrono::steady_clock::now() >= *deadline) return true;
    if (dispatch(deadline) == Code::wouldDeadlock) return false;
  }
  return true;
}

}  // namespace quarvel
