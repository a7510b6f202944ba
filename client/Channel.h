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

/// The connection behind a client: frames calls, matches responses with the calls that wait for
/// them, and makes itself anew where that is wanted. Owned by its client, its thread and its
/// real-time reporters.
///
/// Everything that reads, gives replies or keeps times happens in `step`, on one thread at a time:
/// the driver, which is either the connection's own thread or whoever calls `dispatch`. Calls are
/// written by their callers, as far as that goes.
class __attribute__((visibility("hidden"))) Client::Channel
    : public std::enable_shared_from_this<Client::Channel> {
 public:
  using Time = Poller::Time;

  /// Work that the driver does from time to time, while its owner keeps it.
  class Periodic {
   public:
    virtual ~Periodic() = default;
    /// Runs on the driver. Returns when next; none: no more.
    virtual std::optional<Time> run() = 0;
  };

  /// Errors: `Code::unreachable`, also when the process may have no further descriptor or thread.
  [[nodiscard]] static Result<std::shared_ptr<Channel>> open(Options options);
  Channel(Options options, std::string path);
  ~Channel();

  struct Sent {
    Code code = Code::none;
    /// The number under which the reply is awaited; none for a notification or a call not taken.
    std::optional<std::uint32_t> call;
  };
  /// Sends one call; an empty `reply` makes it a notification.
  template <class Request, class T>
  Sent send(const Request& request, Reply<T> reply) QUARVEL_EXCLUDES(mutex_);

  /// The reply to this call will not be given.
  void forget(std::uint32_t call) QUARVEL_EXCLUDES(mutex_);

  void beginBatch() QUARVEL_EXCLUDES(mutex_);
  void endBatch() QUARVEL_EXCLUDES(mutex_);
  /// Sends what has gathered, whatever batches there are.
  void sendGathered() QUARVEL_EXCLUDES(mutex_);

  /// Has the driver run it at `time`, and again when it says.
  void schedule(Time time, std::weak_ptr<Periodic> work) QUARVEL_EXCLUDES(mutex_);

  [[nodiscard]] bool connected() const QUARVEL_EXCLUDES(mutex_);
  /// Whether a connection is to be expected that is not there.
  [[nodiscard]] bool reconnecting() const QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] int descriptor() const { return ownThread() ? -1 : poller_.descriptor(); }
  /// Whether this thread is the driver, that is, whether this is a reply.
  [[nodiscard]] bool onDriver() const { return driver_.load() == std::this_thread::get_id(); }

  Code dispatch(std::optional<Time> deadline) QUARVEL_EXCLUDES(mutex_);
  /// Drives until `done` or the deadline has passed. False when another thread drives.
  template <std::predicate Done>
  bool driveUntil(Done&& done, std::optional<Time> deadline) QUARVEL_EXCLUDES(mutex_);

  /// Sends what has gathered, closes the connection and waits until every pending call is answered;
  /// on the driver it leaves that to it.
  void close() QUARVEL_EXCLUDES(mutex_);

  [[nodiscard]] static std::optional<Time> DeadlineAfter(
      std::optional<std::chrono::milliseconds> wait);

 private:
  /// This much may gather before it is sent, or before its senders wait.
  static constexpr std::size_t kGatheredBytes = 65'536;
  /// A sender that has written this often on behalf of others leaves the rest to the driver; and so
  /// often the driver reads before it looks at anything else.
  static constexpr int kRounds = 16;
  static constexpr std::size_t kReplyBytes = 67'108'864;

  enum class Link : std::uint8_t { up, down, lost };
  enum class Written : std::uint8_t { all, some, failed };

  struct Pending {
    AnyReply reply;
    SessionCall::Kind kind = SessionCall::Kind::none;
    ReporterID session = 0;
  };
  struct Refused {
    AnyReply reply;
    Code code = Code::none;
  };
  struct Scheduled {
    Time time;
    std::weak_ptr<Periodic> work;
  };

  [[nodiscard]] bool ownThread() const { return options_.driver == Driver::ownThread; }
  [[nodiscard]] Outcome begin(int socket) QUARVEL_EXCLUDES(mutex_);

  [[nodiscard]] Sent take(AnyReply&& reply, const SessionCall& session) QUARVEL_REQUIRES(mutex_);
  [[nodiscard]] Code mayTake(const SessionCall& session, AnyReply& reply) QUARVEL_REQUIRES(mutex_);
  [[nodiscard]] std::uint32_t nextNumber() QUARVEL_REQUIRES(mutex_);
  void refuse(AnyReply&& reply, Code code) QUARVEL_REQUIRES(mutex_);
  template <class Request>
  void frame(const Request& request, std::optional<std::uint32_t> call) QUARVEL_REQUIRES(mutex_);

  void sendWhatIsDue() QUARVEL_REQUIRES(mutex_);
  [[nodiscard]] bool hasOutput() const QUARVEL_REQUIRES(mutex_);
  void write(bool mayWait) QUARVEL_REQUIRES(mutex_);
  [[nodiscard]] Written writeSending(int socket, bool mayWait);
  void watchOutput(bool wanted) QUARVEL_REQUIRES(mutex_);

  [[nodiscard]] bool hasOutputDue() const QUARVEL_REQUIRES(mutex_);

  void run() QUARVEL_EXCLUDES(mutex_);
  void step(std::optional<Time> deadline) QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] bool closing() const QUARVEL_EXCLUDES(mutex_);
  void finish() QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] bool flushed() QUARVEL_EXCLUDES(mutex_);
  void abandon();

  void receiveAndReply() QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] std::optional<std::string> receive(bool& more) QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] std::optional<std::string> giveReplies() QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] bool giveReply(PayloadValue response) QUARVEL_EXCLUDES(mutex_);
  void giveRefusals() QUARVEL_EXCLUDES(mutex_);

  void lose(const std::string& reason, bool forGood) QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] std::size_t dropOutput() QUARVEL_REQUIRES(mutex_);
  [[nodiscard]] std::size_t refusePending() QUARVEL_REQUIRES(mutex_);
  [[nodiscard]] std::chrono::milliseconds nextDelay();
  void reconnect() QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] std::size_t makeSessionsAnew() QUARVEL_REQUIRES(mutex_);
  void runScheduled() QUARVEL_EXCLUDES(mutex_);
  void armTimer() QUARVEL_EXCLUDES(mutex_);

  // Constant after construction.
  const Options options_;
  const std::string path_;
  const pid_t process_;
  Poller poller_;
  std::thread thread_;

  std::atomic<std::thread::id> driver_{};  // changed under the mutex

  mutable Mutex mutex_;
  ConditionVariable room_;  // output was taken, its writer has ended, or the connection has
  Link link_ QUARVEL_GUARDED_BY(mutex_) = Link::lost;
  int socket_ QUARVEL_GUARDED_BY(mutex_) = -1;  // closed only while nobody writes
  std::string gathered_ QUARVEL_GUARDED_BY(mutex_);
  bool writing_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool outputWatched_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool flushing_ QUARVEL_GUARDED_BY(mutex_) = false;  // what gathered goes out despite batches
  int batches_ QUARVEL_GUARDED_BY(mutex_) = 0;
  bool closing_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool finished_ QUARVEL_GUARDED_BY(mutex_) = false;
  std::uint32_t nextCall_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::unordered_map<std::uint32_t, Pending> pending_ QUARVEL_GUARDED_BY(mutex_);
  std::vector<Refused> refused_ QUARVEL_GUARDED_BY(mutex_);  // the driver gives them their errors
  Sessions sessions_ QUARVEL_GUARDED_BY(mutex_);             // kept only to be made anew
  std::size_t unsent_ QUARVEL_GUARDED_BY(mutex_) = 0;        // while the connection is down
  std::vector<Scheduled> scheduled_ QUARVEL_GUARDED_BY(mutex_);

  // Belong to whoever has set `writing_`, who lets go of the mutex to write.
  std::string sending_;
  std::size_t sent_ = 0;

  // The driver's own.
  std::vector<char> received_;
  std::size_t begin_ = 0;
  std::size_t end_ = 0;
  MessagePackScanner scanner_{kReplyBytes, MessagePackScanner::kDeepest};
  std::string lossReason_;
  Time connectedAt_{};
  std::optional<Time> reconnectAt_;
  std::chrono::milliseconds delay_{};
  std::minstd_rand random_;
};

template <class Request, class T>
Client::Channel::Sent Client::Channel::send(const Request& request, Reply<T> reply) {
  AnyReply any;
  if (reply) any = std::move(reply);
  MutexLock lock(mutex_);
  const Sent sent = take(std::move(any), request.session);
  if (sent.code != Code::none) return sent;
  frame(request, sent.call);
  sendWhatIsDue();
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
