#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <unordered_map>
#include <variant>
#include <vector>

#include <quarvel/client.hpp>

#include "base/MessagePack.h"
#include "base/Mutex.h"

namespace quarvel {

/// The socket behind a client: frames calls, matches responses with the calls that wait for them.
/// Owned by its client and by its reader thread.
class __attribute__((visibility("hidden"))) Client::Channel
    : public std::enable_shared_from_this<Client::Channel> {
 public:
  /// How a reply is given; without one a call is a notification.
  using AnyReply =
      std::variant<std::monostate, Reply<bool>, Reply<ServiceType>, Reply<std::monostate>,
                   Reply<Validity>, Reply<std::vector<ReporterID>>, Reply<Value>>;

  /// Takes a connected socket, and the thread that reads it begins. Errors: `Code::unreachable`,
  /// when the process may have no further descriptor or thread.
  [[nodiscard]] static Result<std::shared_ptr<Channel>> serve(int socket);
  Channel(int socket, int wake);
  ~Channel();

  /// Sends one call; `encode` writes its arguments, `count` of them, and must not call back.
  /// Returns the number under which its reply is awaited, none for a notification.
  template <class Encode>
  std::optional<std::uint32_t> send(std::string_view operation, AnyReply reply, std::size_t count,
                                    Encode&& encode) QUARVEL_EXCLUDES(mutex_);

  /// The reply to this call will not be given.
  void forget(std::uint32_t call) QUARVEL_EXCLUDES(mutex_);

  void beginBatch() QUARVEL_EXCLUDES(mutex_);
  void endBatch() QUARVEL_EXCLUDES(mutex_);
  /// Sends what has gathered, whatever batches there are.
  void sendGathered() QUARVEL_EXCLUDES(mutex_);

  [[nodiscard]] bool connected() const QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] bool onReaderThread() const;
  /// Sends what has gathered, closes the connection and waits until every pending call is answered;
  /// called by the reader thread itself it does not wait.
  void close() QUARVEL_EXCLUDES(mutex_);

 private:
  /// This much may gather before it is sent, or before its senders wait.
  static constexpr std::size_t kGatheredBytes = 65'536;
  /// A sender that has written this often on behalf of others leaves the rest to the reader thread.
  static constexpr int kRounds = 16;
  static constexpr std::size_t kReplyBytes = 67'108'864;

  enum class Written { all, some, failed };

  std::optional<std::uint32_t> await(AnyReply&& reply) QUARVEL_REQUIRES(mutex_);
  void sendWhatIsDue(bool gather) QUARVEL_REQUIRES(mutex_);
  void write(bool mayWait) QUARVEL_REQUIRES(mutex_);
  [[nodiscard]] Written writeSending(bool mayWait);
  [[nodiscard]] bool hasOutput() const QUARVEL_REQUIRES(mutex_);
  void wakeReader() const;

  void read();
  [[nodiscard]] std::optional<std::string> receive();
  [[nodiscard]] std::optional<std::string> giveReplies();
  [[nodiscard]] bool giveReply(PayloadValue response);
  void writeAndWait();
  void answerEverything(const std::string& reason);

  // Constant after construction.
  const int socket_;
  const int wake_;  // an eventfd: output is left for the reader thread
  std::thread reader_;

  mutable Mutex mutex_;
  ConditionVariable room_;     // output was taken, or its writer has ended
  ConditionVariable changed_;  // after the loss: a call came, or the client closes
  std::string gathered_ QUARVEL_GUARDED_BY(mutex_);
  bool writing_ QUARVEL_GUARDED_BY(mutex_) = false;
  int batches_ QUARVEL_GUARDED_BY(mutex_) = 0;
  bool lost_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool closing_ QUARVEL_GUARDED_BY(mutex_) = false;
  std::uint32_t nextCall_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::unordered_map<std::uint32_t, AnyReply> pending_ QUARVEL_GUARDED_BY(mutex_);

  // Belong to whoever has set `writing_`, who lets go of the mutex to write.
  std::string sending_;
  std::size_t sent_ = 0;

  // The reader thread's own.
  std::vector<char> received_;
  std::size_t begin_ = 0;
  std::size_t end_ = 0;
  MessagePackScanner scanner_{kReplyBytes, MessagePackScanner::kDeepest};
};

template <class Encode>
std::optional<std::uint32_t> Client::Channel::send(std::string_view operation, AnyReply reply,
                                                   std::size_t count, Encode&& encode) {
  enum : std::int64_t { request = 0, notification = 2 };
  const bool gather = onReaderThread();
  MutexLock lock(mutex_);
  const std::optional<std::uint32_t> call = await(std::move(reply));
  if (lost_) return call;
  MessagePackWriter writer(gathered_);
  writer.list(call ? 4 : 3);
  writer.integer(call ? request : notification);
  if (call) writer.unsignedInteger(*call);
  writer.string(operation);
  writer.list(count);
  encode(writer);
  sendWhatIsDue(gather);
  return call;
}

}  // namespace quarvel
