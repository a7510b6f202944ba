#pragma once

#include <sys/socket.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

#include "base/MessagePack.h"
#include "tests/UnixSocket.h"
#include "transport/ListeningSocket.h"

namespace quarvel::testing {

/// The time-out of every wait for the service. Reached only by a test that fails.
inline constexpr std::chrono::seconds kPatience{60};

/// A client's end of the socket: writes bytes, reads MessagePack values. A call that does not
/// succeed leaves the reason in `errno`: EAGAIN after the time-out, 0 at the end of the stream.
class SocketClient {
 public:
  explicit SocketClient(const std::filesystem::path& service)
      : socket_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    const timeval patience{kPatience.count(), 0};
    ::setsockopt(socket_.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
    ::setsockopt(socket_.get(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
    const sockaddr_un address = UnixAddress(service);
    if (::connect(socket_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address)) {
      std::perror("the client cannot connect");
      std::abort();
    }
  }

  /// Sends all bytes, waiting until the service reads them. A fuzzer's timer may interrupt the
  /// call.
  bool send(std::string_view bytes) {
    while (!bytes.empty()) {
      const ssize_t count =
          TEMP_FAILURE_RETRY(::send(socket_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL));
      if (count <= 0) return false;
      bytes.remove_prefix(static_cast<std::size_t>(count));
    }
    return true;
  }
  /// Reads once.
  bool receive() {
    received_.erase(0, taken_);
    taken_ = 0;
    char bytes[64 * 1024];
    errno = 0;
    const ssize_t count = TEMP_FAILURE_RETRY(::recv(socket_.get(), bytes, sizeof bytes, 0));
    if (count > 0) received_.append(bytes, static_cast<std::size_t>(count));
    return count > 0;
  }
  /// Takes the next value that has been read; valid until `receive`. None when it is incomplete.
  std::optional<PayloadValue> value() {
    MessagePackScanner scanner(std::size_t{1} << 30, MessagePackScanner::kDeepest);
    const std::string_view rest = std::string_view(received_).substr(taken_);
    const auto progress = scanner.scan(rest);
    if (progress == MessagePackScanner::Progress::fault) std::abort();
    if (progress != MessagePackScanner::Progress::complete) return std::nullopt;
    taken_ += scanner.length();
    return PayloadValue(rest.data());
  }
  [[nodiscard]] bool hasUntakenBytes() const { return taken_ < received_.size(); }
  [[nodiscard]] int descriptor() const { return socket_.get(); }
  void stopSending() { ::shutdown(socket_.get(), SHUT_WR); }
  void hangUp() { socket_ = UniqueDescriptor(); }

 private:
  UniqueDescriptor socket_;
  std::string received_;
  std::size_t taken_ = 0;
};

}  // namespace quarvel::testing
