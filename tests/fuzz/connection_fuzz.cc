// A whole connection: the core behind a real listener, queues and sockets. One client sends the
// input and disconnects; a polite client beside it must be served as if it were alone.
//
// An input's first byte selects the client's behaviour, the rest is its stream.

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include <quarvel/client.hpp>

#include "Statistics/Service/ZQReportingServiceDelegate.h"
#include "tests/TemporaryDirectory.h"
#include "tests/fuzz/Require.h"
#include "tests/transport/SocketClient.h"
#include "transport/SocketListener.h"

namespace {

using quarvel::PayloadValue;
using quarvel::testing::kPatience;
using quarvel::testing::SocketClient;

/// Starts the service at the first call, for the life of the process; returns its socket's path.
const std::string& Service() {
  static const std::string path = [] {
    static const quarvel::TemporaryDirectory directory;
    for (const char* name : {"RUNTIME_DIRECTORY", "STATE_DIRECTORY", "CONFIGURATION_DIRECTORY",
                             "QUARVEL_DIAGNOSTICS_PREFIX"}) {
      ::setenv(name, directory.path().c_str(), 1);
    }
    std::string at = directory.path() / "socket";
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

void CheckResponse(PayloadValue response) {
  Require(response.count() == 4, "a response has four items");
  auto item = response.items().begin();
  Require((*item).integer() == 1, "it is a response");
  Require((*++item).unsignedInteger().has_value(), "it has an id");
  const PayloadValue error = *++item;
  const PayloadValue result = *++item;
  Require(error.isNil() || (error.find("domain") && error.find("code") && result.isNil()),
          "an error has a domain and a code");
}

/// Requires that the service answers a polite client, and soon has no session but that client's.
void ServePolitely() {
  static quarvel::Client& polite =
      *new quarvel::Client(std::move(quarvel::Client::connect(Service()).value()));
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
    SocketClient client(Service());
    for (; !stream.empty(); stream.remove_prefix(std::min(piece, stream.size()))) {
      if (client.send(stream.substr(0, piece))) continue;
      Require(errno != EAGAIN, "the service reads on");
      break;
    }
    if (reads) {
      client.stopSending();
      while (client.receive()) {
        while (const auto response = client.value()) CheckResponse(*response);
      }
      Require(errno != EAGAIN, "the service answers or ends");
    }
  }
  ServePolitely();
  return 0;
}
