#pragma once

#include <fmt/format.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstdlib>
#include <deque>
#include <functional>
#include <future>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/Json.h"
#include "base/MessagePack.h"
#include "base/Mutex.h"
#include "queues/CallTracker.h"
#include "tests/LogRecorder.h"
#include "tests/TemporaryDirectory.h"
#include "tests/transport/SocketClient.h"
#include "transport/SocketListener.h"

namespace quarvel {

using testing::kPatience;
using testing::LogRecorder;

/// Records the handlers that ran and the calls that arrived, in order. Any thread.
class Journal {
 public:
  /// A call that has not been answered; with a reference, one that is in flight until this goes.
  struct KeptCall {
    std::int64_t number;
    Reply<std::int64_t> reply;
    CallRef reference;
  };

  struct Record {
    std::vector<std::string> handlers;
    std::vector<std::int64_t> calls;
    std::size_t mostKept = 0;
  };

  void add(std::string handler) {
    const MutexLock lock(mutex_);
    record_.handlers.push_back(std::move(handler));
    changed_.notifyAll();
  }
  void addCall(std::int64_t number, std::optional<KeptCall> kept = std::nullopt) {
    const MutexLock lock(mutex_);
    record_.calls.push_back(number);
    if (kept) kept_.push_back(std::move(*kept));
    record_.mostKept = std::max(record_.mostKept, kept_.size());
    changed_.notifyAll();
  }
  std::optional<KeptCall> takeKeptCall() {
    const MutexLock lock(mutex_);
    if (kept_.empty()) return std::nullopt;
    std::optional<KeptCall> first = std::move(kept_.front());
    kept_.pop_front();
    return first;
  }
  Record record() {
    const MutexLock lock(mutex_);
    return record_;
  }
  bool waitForCalls(std::size_t count) { return wait(count, 0); }
  bool waitForHandlers(std::size_t count) { return wait(0, count); }

 private:
  bool wait(std::size_t calls, std::size_t handlers) {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    const MutexLock lock(mutex_);
    while (record_.calls.size() < calls || record_.handlers.size() < handlers) {
      if (!changed_.waitUntil(mutex_, deadline)) return false;
    }
    return true;
  }

  Mutex mutex_;
  ConditionVariable changed_;
  Record record_ QUARVEL_GUARDED_BY(mutex_);
  std::deque<KeptCall> kept_ QUARVEL_GUARDED_BY(mutex_);
};

/// Operations that answer at once, later, at length or not at all.
class TestObject final : public ExportedObject {
 public:
  explicit TestObject(Journal& journal) : journal_(journal) {}

  void echo(std::int64_t number, Reply<std::int64_t> reply) {
    journal_.addCall(number);
    reply(number);
  }
  void twice(std::int64_t number, Reply<std::int64_t> reply) {
    reply(number);
    reply(number + 1);
  }
  void never(Reply<bool>) {}
  void refuse(ErrorReply reply) { reply(Error{"test", 9, {{"why", "because"}}}); }
  void keep(std::int64_t number, Reply<std::int64_t> reply) {
    journal_.addCall(number, {{number, std::move(reply), CallRef::current()}});
  }
  void later(std::int64_t number, Reply<std::int64_t> reply) {
    journal_.addCall(number, {{number, std::move(reply), CallRef()}});
  }
  void answerUnstored(std::int64_t number, Reply<std::int64_t> reply) {
    reply(number);
    journal_.addCall(number, {{number, {}, CallRef::indirect(CallRef::current().tracker())}});
  }
  void make(std::int64_t number, std::uint32_t size, Reply<std::string> reply) {
    journal_.addCall(number);
    reply(std::string(size, 'x'));
  }
  void describe(std::optional<Payload> payload, std::uint16_t code,
                std::optional<std::vector<std::int64_t>> list, Reply<std::string> reply) {
    reply(fmt::format("{} {} {}", payload ? JsonText(*payload) : "none", code,
                      list ? std::to_string(list->size()) : "none"));
  }

 private:
  Journal& journal_;
};

inline constexpr std::array kTestMethods{
    Exported<&TestObject::echo>("echo:reply:"),
    Exported<&TestObject::twice>("twice:reply:"),
    Exported<&TestObject::never>("never:"),
    Exported<&TestObject::refuse>("refuse:"),
    Exported<&TestObject::keep>("keep:reply:"),
    Exported<&TestObject::later>("later:reply:"),
    Exported<&TestObject::answerUnstored>("answerUnstored:reply:"),
    Exported<&TestObject::make>("make:size:reply:"),
    Exported<&TestObject::describe>("describe:code:list:reply:"),
};
inline constexpr ExportedInterface kTestInterface{"TestProtocol", kTestMethods};

/// The bytes of a call; without an id, of a notification.
inline std::string CallBytes(std::optional<std::uint32_t> messageID, std::string_view method,
                             const List& arguments) {
  std::string bytes;
  MessagePackWriter writer(bytes);
  writer.list(messageID ? 4 : 3);
  writer.integer(messageID ? 0 : 2);
  if (messageID) writer.unsignedInteger(*messageID);
  writer.string(method);
  writer.value(Value(arguments));
  return bytes;
}

class Client : public testing::SocketClient {
 public:
  using SocketClient::SocketClient;
  static constexpr std::int64_t kServedNumber = -1000;

  bool call(std::uint32_t messageID, std::string_view method, const List& arguments) {
    return send(CallBytes(messageID, method, arguments));
  }
  /// The next response as JSON text; "end" when the service has hung up.
  std::string response() {
    for (;;) {
      if (const auto next = value()) return JsonText(next->toValue());
      if (!receive()) return errno == EAGAIN ? "nothing came" : "end";
    }
  }
  /// The next response, "end", or nothing when neither came in time.
  std::string responseWithin(std::chrono::milliseconds time) {
    pollfd waiting{descriptor(), POLLIN, 0};
    if (!hasUntakenBytes() && ::poll(&waiting, 1, static_cast<int>(time.count())) == 0) return {};
    return response();
  }
  /// Calls echo with `kServedNumber`; true when its answer, and nothing else, came back.
  bool isServed() {
    return call(4242, "echo:reply:", {kServedNumber}) && response() == "[1,4242,null,-1000]";
  }
};

/// A listener on a thread of its own, from `begin` to `end`, and its delegate. It finds the socket
/// file of a killed service.
class Service final : public ServiceListenerDelegate {
 public:
  using Work = std::function<void()>;
  static void Run(const Work& work) { work(); }

  /// With `begun` false, clients can connect but are not accepted yet. `run` runs the start and the
  /// I/O thread.
  explicit Service(const Configuration::Limits& limits = {}, bool begun = true,
                   void (*run)(const Work&) = Run)
      : run_(run) {
    LogRecorder::take();
    ::close(BoundSocket(socketPath(), SOCK_STREAM));
    run_([&] { failure = start(limits); });
    if (begun && !failure) begin();
  }
  ~Service() override { end(); }

  Client connect() { return Client(socketPath()); }
  [[nodiscard]] std::filesystem::path socketPath() const { return directory_.path() / "socket"; }
  void begin() {
    serving_ = std::async(std::launch::async, [this] { run_([this] { listener_->resume(); }); });
  }
  void requestEnd() { listener_->requestEnd(); }
  /// Returns when the listener has; aborts when it does not.
  void end() {
    if (!serving_.valid()) return;
    requestEnd();
    if (serving_.wait_for(kPatience) != std::future_status::ready) {
      ADD_FAILURE() << "the service does not end";
      std::abort();
    }
    serving_.get();
  }

  Journal journal;
  // The accepted connections and their objects; to be read once an invalidation handler has run.
  std::vector<std::weak_ptr<ClientConnection>> connections;
  std::vector<std::weak_ptr<ExportedObject>> objects;
  /// Why the service could not start; none when it could.
  std::optional<Error> failure;

 private:
  std::optional<Error> start(const Configuration::Limits& limits) {
    auto socket = ListeningSocket::listeningAt(socketPath());
    if (!socket) return socket.error();
    SocketListener::Options options;
    options.limits = limits;
    options.atEnd.emplace_back([this] { journal.add("ended"); });
    auto listener = SocketListener::create(std::move(socket.value()), std::move(options));
    if (!listener) return listener.error();
    listener_ = std::move(listener.value());
    listener_->setDelegate({this, [](auto*) {}});
    return std::nullopt;
  }
  bool shouldAcceptNewConnection(ServiceListener&,
                                 const std::shared_ptr<ClientConnection>& connection) override {
    const auto object = std::make_shared<TestObject>(journal);
    connections.push_back(connection);
    objects.push_back(object);
    connection->setExportedInterface(kTestInterface);
    connection->setExportedObject(object);
    // Handlers that hold the object, as a careless delegate's might, must not keep it alive.
    connection->setInterruptionHandler([this, object] { journal.add("interrupted"); });
    connection->setInvalidationHandler([this, object] { journal.add("invalidated"); });
    connection->resume();
    return true;
  }

  void (*const run_)(const Work&);
  TemporaryDirectory directory_;
  std::unique_ptr<SocketListener> listener_;
  std::future<void> serving_;
};

}  // namespace quarvel
