#pragma once

#include <chrono>
#include <cstdint>
#include <deque>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "base/Mutex.h"
#include "base/Payload.h"
#include "base/Value.h"
#include "queues/CallTracker.h"
#include "tests/TemporaryDirectory.h"
#include "transport/SocketListener.h"

namespace quarvel {

/// No test passes because of it; it only ends those that fail.
inline constexpr std::chrono::seconds kPatience{60};

/// What happened, in order: error lines of the log and what the handlers were told.
class Journal {
 public:
  /// The one that this program's log is written to.
  static Journal& shared();

  void add(std::string entry);
  void clear();
  std::vector<std::string> entries();
  std::size_t count(std::string_view part);
  /// Waits until an entry contains `part`.
  bool waitFor(std::string_view part);

 private:
  std::size_t countLocked(std::string_view part) QUARVEL_REQUIRES(mutex_);

  Mutex mutex_;
  ConditionVariable changed_;
  std::vector<std::string> entries_ QUARVEL_GUARDED_BY(mutex_);
};

/// What the exported objects of one service have been asked, and the calls they are still working
/// on.
class Ledger {
 public:
  struct Kept {
    std::int64_t number;
    Reply<std::int64_t> reply;
    CallRef work;
  };

  void arrived(std::int64_t number);
  /// As `arrived`; the call stays under way until taken and dropped.
  void keep(std::int64_t number, Reply<std::int64_t> reply);
  std::optional<Kept> takeKept();
  std::vector<std::int64_t> numbers();
  std::size_t largestKept();
  bool waitForArrivals(std::size_t count);

 private:
  Mutex mutex_;
  ConditionVariable changed_;
  std::vector<std::int64_t> numbers_ QUARVEL_GUARDED_BY(mutex_);
  std::deque<Kept> kept_ QUARVEL_GUARDED_BY(mutex_);
  std::size_t largestKept_ QUARVEL_GUARDED_BY(mutex_) = 0;
};

/// A client's end: writes bytes, reads responses.
class Client {
 public:
  explicit Client(const std::filesystem::path& service);

  /// Sends all of it, waiting for the service to take it. False when the service has hung up.
  bool send(std::string_view bytes);
  bool call(std::uint32_t messageID, std::string_view method, List arguments);
  /// The next response as JSON text; "end" when the service has hung up.
  std::string response();
  /// The next response, "end", or nothing when neither came in time.
  std::string responseWithin(std::chrono::milliseconds time);
  /// Calls echo with this number and says whether the answer, and nothing else, came back.
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

/// Whom a listener has served, and with what.
struct Served {
  const std::shared_ptr<Ledger> ledger = std::make_shared<Ledger>();
  /// Of each connection, in order of acceptance; to be read when its end has been heard of.
  std::vector<std::weak_ptr<ClientConnection>> connections;
  std::vector<std::weak_ptr<ExportedObject>> objects;
};
/// A delegate that exports operations that answer at once, later, at length or not at all.
std::shared_ptr<ServiceListenerDelegate> DelegateFor(Served& served);

/// A listener that serves on a thread of its own from `begin` to `end`.
class Service : public Served {
 public:
  /// Begun, unless clients shall connect and nobody look at them yet.
  explicit Service(const Configuration::Limits& limits = {}, bool begun = true);
  ~Service() { end(); }

  Client connect() { return Client(socketPath()); }
  [[nodiscard]] std::filesystem::path socketPath() const { return directory_.path() / "socket"; }
  void begin();
  /// Returns when the listener has.
  void end();
  void requestEnd() { listener_->requestEnd(); }

 private:
  TemporaryDirectory directory_;
  std::unique_ptr<SocketListener> listener_;
  std::thread thread_;
};

}  // namespace quarvel
