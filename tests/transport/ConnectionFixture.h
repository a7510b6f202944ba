#pragma once

#include <chrono>
#include <cstdint>
#include <deque>
#include <filesystem>
#include <functional>
#include <future>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/Mutex.h"
#include "base/Payload.h"
#include "base/Value.h"
#include "queues/CallTracker.h"
#include "tests/TemporaryDirectory.h"
#include "transport/SocketListener.h"

namespace quarvel {

/// The time-out of every wait. Reached only by a test that fails.
inline constexpr std::chrono::seconds kPatience{60};

/// Records events of one service, in order: error lines of the log, handlers that were called and
/// calls that arrived. One for the program, since the log is one; any thread.
class Journal {
 public:
  struct KeptCall {
    std::int64_t number;
    Reply<std::int64_t> reply;
    CallRef reference;
  };

  static Journal& shared();

  void clear();
  void add(std::string entry);
  std::vector<std::string> entries();
  /// Waits until an entry contains `part`.
  bool waitFor(std::string_view part);

  void addCall(std::int64_t number);
  /// As `addCall`; a call with a reference is in flight until it is taken and dropped.
  void keepCall(std::int64_t number, Reply<std::int64_t> reply, CallRef reference);
  std::optional<KeptCall> takeKeptCall();
  std::vector<std::int64_t> calls();
  std::size_t mostKeptCalls();
  bool waitForCalls(std::size_t count);

 private:
  Mutex mutex_;
  ConditionVariable changed_;
  std::vector<std::string> entries_ QUARVEL_GUARDED_BY(mutex_);
  std::vector<std::int64_t> calls_ QUARVEL_GUARDED_BY(mutex_);
  std::deque<KeptCall> kept_ QUARVEL_GUARDED_BY(mutex_);
  std::size_t mostKept_ QUARVEL_GUARDED_BY(mutex_) = 0;
};

/// A client's end: writes bytes, reads responses.
class Client {
 public:
  explicit Client(const std::filesystem::path& service);

  /// Sends all bytes, waiting until the service reads them. False when the service has hung up.
  bool send(std::string_view bytes);
  bool call(std::uint32_t messageID, std::string_view method, List arguments);
  /// The next response as JSON text; "end" when the service has hung up.
  std::string response();
  /// The next response, "end", or nothing when neither came in time.
  std::string responseWithin(std::chrono::milliseconds time);
  /// Calls echo with this number; true when its answer, and nothing else, came back.
  static constexpr std::int64_t kServedNumber = -1000;
  bool isServed();
  void stopSending();
  void hangUp() { socket_ = UniqueDescriptor(); }

 private:
  UniqueDescriptor socket_;
  std::string received_;
  std::size_t taken_ = 0;
};

/// The bytes of a call; without an id, of a notification.
std::string CallBytes(std::optional<std::uint32_t> messageID, std::string_view method,
                      const List& arguments);

/// A listener on a thread of its own, from `begin` to `end`. Its delegate exports operations that
/// answer at once, later, at length or not at all. It finds the socket file of a killed service.
class Service {
 public:
  using Work = std::function<void()>;
  static void Run(const Work& work) { work(); }

  /// With `begun` false, clients can connect but are not accepted yet. `run` runs the start and the
  /// I/O thread.
  explicit Service(const Configuration::Limits& limits = {}, bool begun = true,
                   void (*run)(const Work&) = Run);
  ~Service() { end(); }

  Client connect() { return Client(socketPath()); }
  [[nodiscard]] std::filesystem::path socketPath() const { return directory_.path() / "socket"; }
  void begin();
  /// Returns when the listener has; aborts when it does not.
  void end();
  void requestEnd() { listener_->requestEnd(); }

  Journal& journal = Journal::shared();
  // The accepted connections and their objects; to be read once an invalidation handler has run.
  std::vector<std::weak_ptr<ClientConnection>> connections;
  std::vector<std::weak_ptr<ExportedObject>> objects;
  /// Why the service could not start; none when it could.
  std::optional<Error> failure;

 private:
  Result<std::unique_ptr<SocketListener>> makeListener(const Configuration::Limits& limits);

  void (*const run_)(const Work&);
  TemporaryDirectory directory_;
  std::unique_ptr<SocketListener> listener_;
  std::future<void> serving_;
};

}  // namespace quarvel
