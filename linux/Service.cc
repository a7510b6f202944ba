#include <systemd/sd-daemon.h>

#include <chrono>
#include <csignal>
#include <memory>
#include <utility>

#include "base/Format.h"
#include "base/StandardPaths.h"
#include "device/VerbosePreferences.h"
#include "linux/ProcessErasures.h"
#include "linux/ProcessExporters.h"
#include "linux/ProcessStore.h"
#include "platform/Log.h"
#include "platform/Process.h"
#include "platform/ServiceListener.h"
#include "queues/Work.h"
#include "system/Configuration.h"
#include "system/ServiceManager.h"
#include "system/StatusFile.h"
#include "transport/SocketListener.h"

namespace quarvel {

namespace {

/// The service ends within 5 seconds; what remains of them after this is for what the work leaves
/// behind to reach the medium.
constexpr std::chrono::seconds kWorkMayTake{4};

Result<ListeningSocket> OpenListeningSocket() {
  const int count = ::sd_listen_fds(/*unset_environment=*/1);
  if (count == 0) return ListeningSocket::listeningAt(StandardPaths::process().socket);
  if (count != 1) {
    return Error::because(
        "quarvel.listener", 1,
        count < 0 ? std::string("$LISTEN_FDS or $LISTEN_PID is no number")
                  : fmt::format("one listening socket is expected, but {} are passed in", count));
  }
  return ListeningSocket::inherited(UniqueDescriptor(SD_LISTEN_FDS_START));
}

Result<std::unique_ptr<SocketListener>> OpenListener() {
  SocketListener::Options options;
  options.limits = Configuration::process().limits;
  options.endSignals = {SIGTERM, SIGINT};
  options.atStart = TellManagerReady;
  options.pulse = PingManager;
  options.pulseInterval = ManagerPingInterval();
  options.atEndBegun = TellManagerStopping;
  options.atEnd.emplace_back([] {
    ZQ_FUNCTION("ProcessServiceListener");
    if (!DrainWork(std::chrono::steady_clock::now() + kWorkMayTake)) {
      ZQ_LOG(nullptr, error, "work was still under way when the service had to end");
    }
  });
  // Makes safe what the store has taken and writes the log out; no destructor runs under threads
  // that are still there.
  options.atEnd.emplace_back([] { ExitProcess(0); });

  Result<ListeningSocket> socket = OpenListeningSocket();
  if (!socket) return std::move(socket.error());
  return SocketListener::create(std::move(socket.value()), std::move(options));
}

std::unique_ptr<SocketListener> OpenListenerOrExit() {
  ZQ_FUNCTION("ProcessServiceListener");
  // Writing to what has been closed (a client, a pipe behind standard error) is an error, no end.
  std::signal(SIGPIPE, SIG_IGN);
  Result<std::unique_ptr<SocketListener>> listener = OpenListener();
  if (!listener) {
    ZQ_LOG(nullptr, error, "the service cannot start: {}", listener.error().description());
    ExitProcess(1);
  }
  // With the socket ours, so that a second service never touches the store of one that runs.
  static_cast<void>(ProcessTelemetryStore());
  static_cast<void>(ProcessExporters());
  AnswerErasureRequests();
  FollowVerbosePreferences();
  AnswerStatusRequests();
  return std::move(listener.value());
}

}  // namespace

ServiceListener& ProcessServiceListener() {
  static const std::unique_ptr<SocketListener> listener = OpenListenerOrExit();
  return *listener;
}

}  // namespace quarvel
