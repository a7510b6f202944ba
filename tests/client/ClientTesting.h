#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <future>
#include <thread>

#include <quarvel/client.hpp>

#include "base/Json.h"
#include "base/MessagePack.h"
#include "tests/TemporaryDirectory.h"
#include "tests/UnixSocket.h"

namespace quarvel {

using namespace std::chrono_literals;
using ::testing::AllOf;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using vocabulary::Component;
using vocabulary::Kind;

/// After this long a wait has failed.
inline constexpr std::chrono::seconds kTestTimeout{20};
inline constexpr auto kGeneric = Client::MessageType::generic;

/// The service's end of one client's socket, played by the test.
class FakeService {
 public:
  FakeService() { listen(); }
  ~FakeService() {
    hangUp();
    stopListening();
  }
  FakeService(const FakeService&) = delete;

  [[nodiscard]] const std::filesystem::path& directory() const { return directory_.path(); }
  [[nodiscard]] std::string path() const { return directory() / "reporting.sock"; }

  void listen() {
    listener_ = BoundSocket(path(), SOCK_STREAM);
    EXPECT_EQ(::listen(listener_, 8), 0);
    limitWaits(listener_);
  }
  /// The socket file stays, as when a service dies.
  void stopListening() {
    if (listener_ >= 0) ::close(std::exchange(listener_, -1));
  }
  void accept() {
    connection_ = ::accept(listener_, nullptr, nullptr);
    limitWaits(connection_);
  }
  void hangUp() {
    if (connection_ >= 0) ::close(std::exchange(connection_, -1));
    received_.clear();
  }

  /// The next call, waited for; none when the client has closed.
  std::optional<std::string> receiveBytes() {
    while (scanner_.scan(received_) != MessagePackScanner::Progress::complete) {
      char bytes[65'536];
      const ssize_t count = ::recv(connection_, bytes, sizeof bytes, 0);
      EXPECT_FALSE(count < 0 && errno == EAGAIN) << "no call has come in time";
      if (count <= 0) return std::nullopt;
      received_.append(bytes, static_cast<std::size_t>(count));
    }
    std::string frame = received_.substr(0, scanner_.length());
    received_.erase(0, scanner_.length());
    scanner_.reset();
    return frame;
  }
  /// False when the client closes before it has sent so many calls.
  bool receive(int calls = 1) {
    while (calls > 0 && receiveBytes()) --calls;
    return calls == 0;
  }
  /// The next call; throws when there is none.
  Value call() { return PayloadValue(receiveBytes().value().data()).toValue(); }
  /// Whether the client has sent bytes that were not received yet.
  [[nodiscard]] bool hasInput() const {
    char byte = 0;
    return !received_.empty() || ::recv(connection_, &byte, 1, MSG_PEEK | MSG_DONTWAIT) == 1;
  }
  void send(std::string_view bytes) {
    ::send(connection_, bytes.data(), bytes.size(), MSG_NOSIGNAL);  // waits until all is taken
  }
  [[nodiscard]] static std::string response(const Value& call, const Value& error,
                                            const Value& result) {
    std::string bytes;
    MessagePackWriter(bytes).value(Value(List{1, (*call.list())[1], error, result}));
    return bytes;
  }
  void reply(const Value& call, const Value& result) { send(response(call, nullptr, result)); }
  void answer(const Value& result) { reply(call(), result); }

 private:
  static void limitWaits(int socket) {
    const timeval timeout{kTestTimeout.count(), 0};
    ::setsockopt(socket, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
  }

  const TemporaryDirectory directory_;
  int listener_ = -1;
  int connection_ = -1;
  std::string received_;
  MessagePackScanner scanner_{std::size_t{1} << 24, 32};
};

template <class T>
std::string Text(const Result<T>& result) {
  return result ? "ok" : result.error().description();
}

inline bool IsCode(const Error& error, Client::Code code) {
  return error.domain == Client::kErrorDomain && error.code == static_cast<std::int64_t>(code);
}

/// A reply for which a test can wait.
template <class T>
class Expected {
 public:
  Client::Reply<T> reply() {
    return [promise = promise_](Result<T> result) { promise->set_value(std::move(result)); };
  }
  Result<T> get() {
    if (future_.wait_for(kTestTimeout) == std::future_status::ready) return future_.get();
    return Error::because("test", 1, "no reply has come in time");
  }
  bool given() { return future_.wait_for(0s) == std::future_status::ready; }

 private:
  std::shared_ptr<std::promise<Result<T>>> promise_ = std::make_shared<std::promise<Result<T>>>();
  std::future<Result<T>> future_ = promise_->get_future();
};

/// A service and its client, which the test drives unless the options say otherwise.
class DrivenClient : public ::testing::Test {
 protected:
  DrivenClient() {
    options_.socketPath = service_.path();
    options_.driver = Client::Driver::caller;
  }
  Client& connect() {
    auto connected = Client::connect(options_);
    EXPECT_TRUE(connected.ok()) << Text(connected);
    client_ = std::make_unique<Client>(std::move(connected.value()));
    service_.accept();
    return *client_;
  }
  void disconnect() {
    client_.reset();
    service_.hangUp();
  }
  /// Drives the client; where it has its own thread, waits for that.
  template <class Done>
  void driveUntil(Done done) {
    Client& client = *client_;  // a reply may reset the member
    const auto deadline = std::chrono::steady_clock::now() + kTestTimeout;
    while (!done()) {
      ASSERT_LT(std::chrono::steady_clock::now(), deadline);
      if (client.dispatch(1s) == Client::Code::wouldDeadlock) std::this_thread::yield();
    }
  }
  void loseConnection() {
    service_.hangUp();
    driveUntil([&] { return !client_->connected(); });
  }

  FakeService service_;
  Client::Options options_;
  std::unique_ptr<Client> client_;
};

}  // namespace quarvel
