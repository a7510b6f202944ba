#pragma once

#include <unistd.h>

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "base/MessagePack.h"
#include "base/Payload.h"
#include "tests/TemporaryDirectory.h"
#include "tests/UnixSocket.h"

namespace quarvel::test {

/// The service's end of one client's socket, played by the test: receives a call when the test asks
/// for one and replies what the test says.
class FakeService {
 public:
  FakeService() { listen(); }
  void listen() {
    listener_ = BoundSocket(path(), SOCK_STREAM);
    EXPECT_EQ(::listen(listener_, 8), 0);
  }
  ~FakeService() {
    hangUp();
    stopListening();
  }
  FakeService(const FakeService&) = delete;
  FakeService& operator=(const FakeService&) = delete;

  [[nodiscard]] const std::filesystem::path& directory() const { return directory_.path(); }
  [[nodiscard]] std::string path() const { return directory() / "reporting.sock"; }

  void accept() { connection_ = ::accept(listener_, nullptr, nullptr); }
  void hangUp() {
    if (connection_ >= 0) ::close(std::exchange(connection_, -1));
    received_.clear();
  }
  /// The socket file stays, as when a service dies.
  void stopListening() {
    if (listener_ >= 0) ::close(std::exchange(listener_, -1));
  }

  /// The next call, waited for; none when the client has closed.
  std::optional<Value> receive() {
    const std::optional<std::string> frame = receiveBytes();
    if (!frame) return std::nullopt;
    return PayloadValue(frame->data()).toValue();
  }
  std::optional<std::string> receiveBytes() {
    for (;;) {
      if (!received_.empty() &&
          scanner_.scan(received_) == MessagePackScanner::Progress::complete) {
        std::string frame = received_.substr(0, scanner_.length());
        received_.erase(0, scanner_.length());
        scanner_.reset();
        return frame;
      }
      char bytes[65'536];
      const ssize_t count = ::recv(connection_, bytes, sizeof bytes, 0);
      if (count <= 0) return std::nullopt;
      received_.append(bytes, static_cast<std::size_t>(count));
    }
  }
  /// Whether the client has sent anything that was not received yet.
  [[nodiscard]] bool somethingWaits() const {
    char byte = 0;
    return !received_.empty() || ::recv(connection_, &byte, 1, MSG_PEEK | MSG_DONTWAIT) == 1;
  }

  void send(std::string_view bytes) {
    while (!bytes.empty()) {
      const ssize_t count = ::send(connection_, bytes.data(), bytes.size(), MSG_NOSIGNAL);
      if (count <= 0) return;
      bytes.remove_prefix(static_cast<std::size_t>(count));
    }
  }
  [[nodiscard]] static std::string response(const Value& call, const Value& error,
                                            const Value& result) {
    std::string bytes;
    MessagePackWriter(bytes).value(Value(List{1, (*call.list())[1], error, result}));
    return bytes;
  }
  void reply(const Value& call, const Value& result) { send(response(call, nullptr, result)); }

 private:
  const TemporaryDirectory directory_;
  int listener_ = -1;
  int connection_ = -1;
  std::string received_;
  MessagePackScanner scanner_{std::size_t{1} << 24, 32};
};

}  // namespace quarvel::test
