// A whole connection: the core behind a real listener, queues and sockets. One client sends
// whatever bytes come, as it pleases, and goes; beside it a polite one is served as if it were
// alone.
//
// An input's first byte says how the client behaves, the rest is its stream.

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <initializer_list>
#include <string>
#include <string_view>
#include <thread>

#include "Statistics/Service/ZQReportingServiceDelegate.h"
#include "base/MessagePack.h"
#include "base/Payload.h"
#include "platform/linux/connection/SocketListener.h"
#include "tests/TemporaryDirectory.h"
#include "tests/UnixSocket.h"
#include "tests/fuzz/Require.h"

namespace {

using quarvel::MessagePackScanner;
using quarvel::MessagePackWriter;
using quarvel::PayloadValue;

/// In seconds of real time; nothing should take a thousandth of it.
constexpr timeval kPatience{30, 0};

std::filesystem::path ServePath() {
  static const quarvel::TemporaryDirectory directory;
  for (const char* name : {"RUNTIME_DIRECTORY", "STATE_DIRECTORY", "CONFIGURATION_DIRECTORY",
                           "QUARVEL_DIAGNOSTICS_PREFIX"}) {
    ::setenv(name, directory.path().c_str(), 1);
  }
  return directory.path() / "socket";
}

/// The service, begun once and never ended.
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
    ::setsockopt(socket_, SOL_SOCKET, SO_RCVTIMEO, &kPatience, sizeof kPatience);
    ::setsockopt(socket_, SOL_SOCKET, SO_SNDTIMEO, &kPatience, sizeof kPatience);
    const sockaddr_un address = quarvel::UnixAddress(Service());
    Require(::connect(socket_, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0,
            "a connection");
  }
  ~Client() { ::close(socket_); }
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  /// False when the service has hung up.
  bool send(std::string_view bytes) {
    while (!bytes.empty()) {
      // The fuzzer interrupts its own thread now and then.
      const ssize_t count =
          TEMP_FAILURE_RETRY(::send(socket_, bytes.data(), bytes.size(), MSG_NOSIGNAL));
      Require(count > 0 || (errno != EAGAIN && errno != EWOULDBLOCK), "the service reads on");
      if (count <= 0) return false;
      bytes.remove_prefix(static_cast<std::size_t>(count));
    }
    return true;
  }
  void stopSending() { ::shutdown(socket_, SHUT_WR); }

  /// What has come, after one more read; false at the end of the stream.
  bool receive() {
    char bytes[4096];
    const ssize_t count = TEMP_FAILURE_RETRY(::recv(socket_, bytes, sizeof bytes, 0));
    Require(count >= 0 || (errno != EAGAIN && errno != EWOULDBLOCK), "the service answers or ends");
    if (count <= 0) return false;
    received_.append(bytes, static_cast<std::size_t>(count));
    return true;
  }
  /// Gives `look` the id and the result of the next response, if it has come whole.
  template <class Look>
  bool response(Look&& look) {
    MessagePackScanner scanner(std::size_t{1} << 24, MessagePackScanner::kDeepest);
    const auto progress = scanner.scan(received_);
    Require(progress != MessagePackScanner::Progress::fault, "the service sends MessagePack");
    if (progress != MessagePackScanner::Progress::complete) return false;
    const PayloadValue response(received_.data());
    Require(response.count() == 4, "a response has four items");
    auto item = response.items().begin();
    Require((*item).integer() == 1, "it is a response");
    const auto id = (*++item).unsignedInteger();
    const PayloadValue error = *++item;
    const PayloadValue result = *++item;
    Require(id.has_value(), "it has an id");
    Require(error.isNil() || (error.find("domain") && error.find("code") && result.isNil()),
            "an error says what it is");
    look(*id, result);
    received_.erase(0, scanner.length());
    return true;
  }

 private:
  const int socket_;
  std::string received_;
};

/// One that is served as it should be, or the service has failed.
class PoliteClient : Client {
 public:
  /// Makes sure that the service serves, and soon has nobody's sessions but this client's.
  void call() {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(kPatience.tv_sec);
    while (!isAlone()) {
      Require(std::chrono::steady_clock::now() < deadline, "the sessions of those who went go");
      std::this_thread::yield();
    }
  }

 private:
  static constexpr std::int64_t kReporterID = 4711;

  void append(const char* method, std::initializer_list<std::int64_t> arguments) {
    MessagePackWriter writer(bytes_);
    writer.list(4);
    writer.integer(0);
    writer.unsignedInteger(++calls_);
    writer.string(method);
    writer.list(arguments.size());
    for (const std::int64_t argument : arguments) writer.integer(argument);
  }

  bool isAlone() {
    bytes_.clear();
    // Anew each time, since others may have started it and sent to it.
    append("createReportingSession:reply:", {kReporterID});
    append("getAllReporters:", {});
    Require(send(bytes_), "the polite client is heard");
    bool answered = false;
    bool alone = false;
    const auto look = [&](std::uint64_t id, PayloadValue result) {
      if (id != calls_) return;
      answered = true;
      alone = result.count() == 1 && (*result.items().begin()).integer() == kReporterID;
    };
    while (!answered) {
      if (!response(look)) Require(receive(), "the polite client is answered");
    }
    return alone;
  }

  std::uint64_t calls_ = 0;
  std::string bytes_;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::string_view stream(reinterpret_cast<const char*>(data), size);
  // That call ends the process, as it should.
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
        while (client.response([](std::uint64_t, PayloadValue) {})) {
        }
      } while (client.receive());
    }
  }
  static PoliteClient& polite = *new PoliteClient;
  polite.call();
  return 0;
}
