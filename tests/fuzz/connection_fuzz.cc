// A whole connection: the core behind a real listener, queues and sockets. One client sends the
// input and disconnects; a polite client beside it must be served as if it were alone.
//
// An input's first byte selects the client's behaviour, the rest is its stream.

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include <quarvel/client.hpp>

#include "Statistics/Service/ZQReportingServiceDelegate.h"
#include "base/MessagePack.h"
#include "base/Payload.h"
#include "tests/TemporaryDirectory.h"
#include "tests/UnixSocket.h"
#include "tests/fuzz/Require.h"
#include "transport/SocketListener.h"

namespace {

using quarvel::MessagePackScanner;
using quarvel::PayloadValue;

/// A thousand times as long as any step should take.
constexpr std::chrono::seconds kPatience(30);

std::filesystem::path ServePath() {
  static const quarvel::TemporaryDirectory directory;
  for (const char* name : {"RUNTIME_DIRECTORY", "STATE_DIRECTORY", "CONFIGURATION_DIRECTORY",
                           "QUARVEL_DIAGNOSTICS_PREFIX"}) {
    ::setenv(name, directory.path().c_str(), 1);
  }
  return directory.path() / "socket";
}

/// Starts the service at the first call, for the life of the process; returns its socket's path.
const std::filesystem::path& Service() {
  static const std::filesystem::path path = [] {
    std::filesystem::path at = ServePath();
    quarvel::SocketListener::Options options;
    options.limits.messageBytes = 16 * 1024;
    options.limits.replyBytes = 16 * 1024;
    options.limits.queuedCalls = 32;
    options.limits.stall = std::chrono::milliseconds(200);
    auto socket = quarvel::ListeningSocket::listeningAt(at);
    Require(socket.ok(), "a listening socket");
    auto listener = quarvel::SocketListener::create(std::move(socket.value()), std::move(options));
    Require(listener.ok(), "a listener");
    std::thread([serving = std::move(listener.value())] {
      serving->setDelegate(quarvel::ZQReportingServiceDelegate::create());
      serving->resume();
    }).detach();
    return at;
  }();
  return path;
}

class Client {
 public:
  Client() : socket_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    const timeval patience{kPatience.count(), 0};
    ::setsockopt(socket_, SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
    ::setsockopt(socket_, SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
    const sockaddr_un address = quarvel::UnixAddress(Service());
    Require(::connect(socket_, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0,
            "a connection");
  }
  ~Client() { ::close(socket_); }
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  /// False when the service has closed the connection.
  bool send(std::string_view bytes) {
    while (!bytes.empty()) {
      // libFuzzer's timer signal may interrupt the call.
      const ssize_t count =
          TEMP_FAILURE_RETRY(::send(socket_, bytes.data(), bytes.size(), MSG_NOSIGNAL));
      Require(count > 0 || (errno != EAGAIN && errno != EWOULDBLOCK), "the service reads on");
      if (count <= 0) return false;
      bytes.remove_prefix(static_cast<std::size_t>(count));
    }
    return true;
  }
  void stopSending() { ::shutdown(socket_, SHUT_WR); }

  /// Reads once; false at the end of the stream.
  bool receive() {
    char bytes[4096];
    const ssize_t count = TEMP_FAILURE_RETRY(::recv(socket_, bytes, sizeof bytes, 0));
    Require(count >= 0 || (errno != EAGAIN && errno != EWOULDBLOCK), "the service answers or ends");
    if (count <= 0) return false;
    received_.append(bytes, static_cast<std::size_t>(count));
    return true;
  }
  /// Removes and checks the next response; false while it is incomplete.
  bool response() {
    MessagePackScanner scanner(std::size_t{1} << 24, MessagePackScanner::kDeepest);
    const auto progress = scanner.scan(received_);
    Require(progress != MessagePackScanner::Progress::fault, "the service sends MessagePack");
    if (progress != MessagePackScanner::Progress::complete) return false;
    const PayloadValue response(received_.data());
    Require(response.count() == 4, "a response has four items");
    auto item = response.items().begin();
    Require((*item).integer() == 1, "it is a response");
    Require((*++item).unsignedInteger().has_value(), "it has an id");
    const PayloadValue error = *++item;
    const PayloadValue result = *++item;
    Require(error.isNil() || (error.find("domain") && error.find("code") && result.isNil()),
            "an error has a domain and a code");
    received_.erase(0, scanner.length());
    return true;
  }

 private:
  const int socket_;
  std::string received_;
};

/// Requires that the service answers a polite client, and soon has no session but that client's.
void ServePolitely() {
  static quarvel::Client& polite =
      *new quarvel::Client(std::move(quarvel::Client::connect(Service().string()).value()));
  constexpr quarvel::ReporterID kReporterID = 4711;
  auto sync = polite.sync(kPatience);
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  for (;;) {
    // Created anew each time, since an input may have used the same ID.
    Require(sync.createReportingSession(kReporterID).ok(), "the polite client is served");
    const auto reporters = sync.getAllReporters();
    Require(reporters.ok(), "the polite client is answered");
    if (reporters.value() == std::vector{kReporterID}) return;
    Require(std::chrono::steady_clock::now() < deadline,
            "the sessions of disconnected clients end");
    std::this_thread::yield();
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::string_view stream(reinterpret_cast<const char*>(data), size);
  // This call rightly ends the process.
  if (stream.empty() || stream.find("killService") != std::string_view::npos) return 0;
  const unsigned behaviour = static_cast<unsigned char>(stream.front());
  stream.remove_prefix(1);
  const bool reads = (behaviour & 1) == 0;
  const std::size_t piece = (behaviour & 2) == 0 ? stream.size() : 1 + behaviour / 4;
  {
    Client client;
    for (; !stream.empty(); stream.remove_prefix(std::min(piece, stream.size()))) {
      if (!client.send(stream.substr(0, piece))) break;
    }
    if (reads) {
      client.stopSending();
      do {
        while (client.response()) continue;
      } while (client.receive());
    }
  }
  ServePolitely();
  return 0;
}
