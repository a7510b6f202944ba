#include "tests/transport/ConnectionFixture.h"

#include <fmt/format.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <utility>

#include "base/Json.h"
#include "base/MessagePack.h"
#include "platform/Log.h"
#include "tests/UnixSocket.h"

namespace quarvel {

// The log of this program: error lines go to the journal.
bool ZQLogEnabled(LogLevel level, LogHandle) {
  return level == LogLevel::error;
}
void ZQLogWrite(LogHandle, LogLevel, const char*, int, const char*, std::string_view message) {
  Journal::shared().add(fmt::format("error: {}", message));
}

namespace {

class TestService final : public ExportedObject {
 public:
  void echo(std::int64_t number, Reply<std::int64_t> reply) {
    Journal::shared().addCall(number);
    reply(number);
  }
  void twice(std::int64_t number, Reply<std::int64_t> reply) {
    reply(number);
    reply(number + 1);
  }
  void never(Reply<bool>) {}
  void refuse(ErrorReply reply) { reply(Error{"test", 9, {{"why", "because"}}}); }
  void keep(std::int64_t number, Reply<std::int64_t> reply) {
    Journal::shared().keepCall(number, std::move(reply), CallRef::current());
  }
  void later(std::int64_t number, Reply<std::int64_t> reply) {
    Journal::shared().keepCall(number, std::move(reply), CallRef());
  }
  void answerUnstored(std::int64_t number, Reply<std::int64_t> reply) {
    reply(number);
    Journal::shared().keepCall(number, {}, CallRef::indirect(CallRef::current().tracker()));
  }
  void make(std::int64_t number, std::uint32_t size, Reply<std::string> reply) {
    Journal::shared().addCall(number);
    reply(std::string(size, 'x'));
  }
  void describe(std::optional<Payload> payload, std::uint16_t code,
                std::optional<std::vector<std::int64_t>> list, Reply<std::string> reply) {
    reply(fmt::format("{} {} {}", payload ? JsonText(*payload) : "none", code,
                      list ? std::to_string(list->size()) : "none"));
  }
};

constexpr std::array kTestMethods{
    Exported<&TestService::echo>("echo:reply:"),
    Exported<&TestService::twice>("twice:reply:"),
    Exported<&TestService::never>("never:"),
    Exported<&TestService::refuse>("refuse:"),
    Exported<&TestService::keep>("keep:reply:"),
    Exported<&TestService::later>("later:reply:"),
    Exported<&TestService::answerUnstored>("answerUnstored:reply:"),
    Exported<&TestService::make>("make:size:reply:"),
    Exported<&TestService::describe>("describe:code:list:reply:"),
};
constexpr ExportedInterface kTestInterface{"TestProtocol", kTestMethods};

class TestDelegate final : public ServiceListenerDelegate {
 public:
  explicit TestDelegate(Service& service) : service_(service) {}

  bool shouldAcceptNewConnection(ServiceListener&,
                                 const std::shared_ptr<ClientConnection>& connection) override {
    const auto object = std::make_shared<TestService>();
    service_.connections.push_back(connection);
    service_.objects.push_back(object);
    connection->setExportedInterface(kTestInterface);
    connection->setExportedObject(object);
    // Handlers that hold the object, as a careless delegate's might, must not keep it alive.
    connection->setInterruptionHandler([object] { Journal::shared().add("interrupted"); });
    connection->setInvalidationHandler([object] { Journal::shared().add("invalidated"); });
    connection->resume();
    return true;
  }

 private:
  Service& service_;
};

}  // namespace

Journal& Journal::shared() {
  static Journal journal;
  return journal;
}

void Journal::clear() {
  std::deque<KeptCall> kept;  // destroyed without the lock
  MutexLock lock(mutex_);
  entries_.clear();
  calls_.clear();
  kept.swap(kept_);
  mostKept_ = 0;
}

void Journal::add(std::string entry) {
  MutexLock lock(mutex_);
  entries_.push_back(std::move(entry));
  changed_.notifyAll();
}

std::vector<std::string> Journal::entries() {
  MutexLock lock(mutex_);
  return entries_;
}

bool Journal::waitFor(std::string_view part) {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  MutexLock lock(mutex_);
  while (std::ranges::none_of(entries_, [part](const std::string& entry) {
    return entry.find(part) != std::string::npos;
  })) {
    if (!changed_.waitUntil(mutex_, deadline)) return false;
  }
  return true;
}

void Journal::addCall(std::int64_t number) {
  MutexLock lock(mutex_);
  calls_.push_back(number);
  changed_.notifyAll();
}

void Journal::keepCall(std::int64_t number, Reply<std::int64_t> reply, CallRef reference) {
  MutexLock lock(mutex_);
  calls_.push_back(number);
  kept_.push_back({number, std::move(reply), std::move(reference)});
  mostKept_ = std::max(mostKept_, kept_.size());
  changed_.notifyAll();
}

std::optional<Journal::KeptCall> Journal::takeKeptCall() {
  MutexLock lock(mutex_);
  if (kept_.empty()) return std::nullopt;
  std::optional<KeptCall> first = std::move(kept_.front());
  kept_.pop_front();
  return first;
}

std::vector<std::int64_t> Journal::calls() {
  MutexLock lock(mutex_);
  return calls_;
}

std::size_t Journal::mostKeptCalls() {
  MutexLock lock(mutex_);
  return mostKept_;
}

bool Journal::waitForCalls(std::size_t count) {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  MutexLock lock(mutex_);
  while (calls_.size() < count) {
    if (!changed_.waitUntil(mutex_, deadline)) return false;
  }
  return true;
}

Client::Client(const std::filesystem::path& service)
    : socket_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
  const timeval patience{kPatience.count(), 0};
  ::setsockopt(socket_.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  ::setsockopt(socket_.get(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
  const sockaddr_un address = UnixAddress(service);
  EXPECT_EQ(::connect(socket_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address),
            0)
      << std::strerror(errno);
}

bool Client::send(std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t count = ::send(socket_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
    if (count <= 0) return false;
    bytes.remove_prefix(static_cast<std::size_t>(count));
  }
  return true;
}

bool Client::call(std::uint32_t messageID, std::string_view method, List arguments) {
  return send(CallBytes(messageID, method, std::move(arguments)));
}

std::string Client::response() {
  MessagePackScanner scanner(std::size_t{1} << 30, MessagePackScanner::kDeepest);
  for (;;) {
    const std::string_view rest = std::string_view(received_).substr(taken_);
    if (scanner.scan(rest) == MessagePackScanner::Progress::complete) {
      taken_ += scanner.length();
      return JsonText(PayloadValue(rest.data()).toValue());
    }
    received_.erase(0, taken_);
    taken_ = 0;
    char bytes[64 * 1024];
    const ssize_t count = ::recv(socket_.get(), bytes, sizeof bytes, 0);
    if (count < 0 && errno == EAGAIN) return "nothing came";
    if (count <= 0) return "end";
    received_.append(bytes, static_cast<std::size_t>(count));
  }
}

std::string Client::responseWithin(std::chrono::milliseconds time) {
  pollfd descriptor{socket_.get(), POLLIN, 0};
  if (taken_ == received_.size() && ::poll(&descriptor, 1, static_cast<int>(time.count())) == 0) {
    return {};
  }
  return response();
}

bool Client::isServed() {
  return call(4242, "echo:reply:", {kServedNumber}) && response() == "[1,4242,null,-1000]";
}

void Client::stopSending() {
  ::shutdown(socket_.get(), SHUT_WR);
}

std::string CallBytes(std::optional<std::uint32_t> messageID, std::string_view method,
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

Service::Service(const Configuration::Limits& limits, bool begun, void (*run)(const Work&))
    : run_(run) {
  journal.clear();
  ::close(BoundSocket(socketPath(), SOCK_STREAM));
  run_([&] {
    if (auto listener = makeListener(limits)) {
      listener_ = std::move(listener.value());
    } else {
      failure = std::move(listener.error());
    }
  });
  if (begun && !failure) begin();
}

Result<std::unique_ptr<SocketListener>> Service::makeListener(const Configuration::Limits& limits) {
  SocketListener::Options options;
  options.limits = limits;
  options.atEnd.emplace_back([this] { journal.add("ended"); });
  auto socket = ListeningSocket::listeningAt(socketPath());
  if (!socket) return std::move(socket.error());
  auto listener = SocketListener::create(std::move(socket.value()), std::move(options));
  if (listener) listener.value()->setDelegate(std::make_shared<TestDelegate>(*this));
  return listener;
}

void Service::begin() {
  serving_ = std::async(std::launch::async, [this] { run_([this] { listener_->resume(); }); });
}

void Service::end() {
  if (!serving_.valid()) return;
  requestEnd();
  if (serving_.wait_for(kPatience) != std::future_status::ready) {
    ADD_FAILURE() << "the service does not end";
    std::abort();
  }
  serving_.get();
}

}  // namespace quarvel
