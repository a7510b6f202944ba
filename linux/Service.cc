#include "linux/Service.h"

#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <atomic>
#include <cassert>
#include <chrono>
#include <csignal>
#include <utility>

#include "base/Files.h"
#include "base/Format.h"
#include "device/OrientationFiles.h"
#include "device/OrientationSensor.h"
#include "platform/Clock.h"
#include "platform/Log.h"

namespace quarvel {

namespace {

/// The service ends within 5 s; the rest of them is for the store, whose last rows have to reach
/// the medium.
constexpr std::chrono::seconds kWorkMayTake{4};

std::atomic<Service*> runningService{nullptr};

Result<ListeningSocket> OpenListeningSocket(const StandardPaths& paths) {
  const int count = ::sd_listen_fds(/*unset_environment=*/1);
  if (count == 0) return ListeningSocket::listeningAt(paths.socket);
  if (count != 1) {
    return Error::because(
        "quarvel.listener", 1,
        count < 0 ? std::string("$LISTEN_FDS or $LISTEN_PID is no number")
                  : fmt::format("one listening socket is expected, but {} are passed in", count));
  }
  return ListeningSocket::inherited(UniqueDescriptor(SD_LISTEN_FDS_START));
}

}  // namespace

Service::Running::Running(Service& service) {
  assert(runningService == nullptr);
  runningService = &service;
}

Service::Running::~Running() {
  runningService = nullptr;
}

Service* Service::running() {
  return runningService.load(std::memory_order_acquire);
}

Service& Service::current() {
  assert(running() != nullptr);
  return *running();
}

Service::Service()
    : paths_(StandardPaths::fromEnvironment(geteuid() == 0)),
      configuration_(readConfiguration()),
      notifications_(paths_.runtime / "notify", watch_),
      preferences_(paths_.configuration / "preferences"),
      tallix_(configuration_.tallix),
      listener_((setOrientationSource(), openListener())),
      store_(openStore()),
      events_(store_),
      analytics_(events_, configuration_.analyticsWanted),
      agent_(store_, configuration_.agent.backends),
      remoteBackends_(configuration_, configurationFile(), *store_, status_, processExit_),
      erasures_(paths_.runtime / "erase", *store_, remoteBackends_.exporters()),
      statusFile_(status_, paths_.runtime / "status.json") {}

// Members are destroyed once no thread uses them: first the sources of work end, then the work that
// uses the store and the exporters, then these, then the work that their end has caused.
Service::~Service() {
  constexpr auto kForever = std::chrono::steady_clock::time_point::max();
  watch_.end();
  static_cast<void>(queues_.drain(kForever));
  processExit_.runWork();
  static_cast<void>(queues_.drain(kForever));
}

std::filesystem::path Service::configurationFile() const {
  return paths_.configuration / Configuration::kFileName;
}

Configuration Service::readConfiguration() {
  ZQ_FUNCTION("ConfigurationRead");
  std::vector<std::string> warnings;
  Result<Configuration> configuration =
      Configuration::read(configurationFile(), RemoteBackends::kinds(), warnings);
  if (!configuration) {
    const std::string* const reason = configuration.error().userInfo.find("reason")->string();
    ZQ_LOG(nullptr, error, "{}", *reason);
    processExit_.exit(1);
  }
  log_.setLevel(configuration.value().logLevel);
  for (const std::string& warning : warnings) ZQ_LOG(nullptr, standard, "{}", warning);
  return std::move(configuration.value());
}

void Service::setOrientationSource() {
  switch (configuration_.orientation) {
    case Configuration::OrientationSource::files:
      orientation_.setSource(
          std::make_unique<OrientationFiles>(orientation_, paths_.runtime, watch_));
      break;
    case Configuration::OrientationSource::iio:
      orientation_.setSource(std::make_unique<OrientationSensor>(orientation_));
      break;
    case Configuration::OrientationSource::none:
      break;
  }
}

std::unique_ptr<SocketListener> Service::openListener() {
  ZQ_FUNCTION("ProcessServiceListener");
  // Writing to a closed descriptor (a client, a pipe behind standard error) is an error, no end.
  std::signal(SIGPIPE, SIG_IGN);
  SocketListener::Options options;
  options.limits = configuration_.limits;
  options.endSignals = {SIGTERM, SIGINT};
  options.atStart = [this] { manager_.reportReady(); };
  options.pulse = [this] { manager_.ping(); };
  options.pulseInterval = ServiceManager::pingInterval();
  options.atEndBegun = [this] { manager_.reportStopping(); };
  options.atEnd.emplace_back([this] {
    if (!queues_.drain(std::chrono::steady_clock::now() + kWorkMayTake)) {
      ZQ_LOG(nullptr, error, "work was still under way when the service had to end");
    }
  });
  Result<ListeningSocket> socket = OpenListeningSocket(paths_);
  auto listener = socket ? SocketListener::create(std::move(socket.value()), std::move(options))
                         : Result<std::unique_ptr<SocketListener>>(std::move(socket.error()));
  if (!listener) {
    ZQ_LOG(nullptr, error, "the service cannot start: {}", listener.error().description());
    processExit_.exit(1);
  }
  return std::move(listener.value());
}

std::shared_ptr<TelemetryStore> Service::openStore() {
  ZQ_FUNCTION("ProcessTelemetryStore");
  TelemetryStore::Options options;
  options.path = configuration_.store.path;
  if (options.path.empty()) {
    // The state directory is the service's own to make; a configured one is not.
    (void)CreatePrivateDirectory(paths_.state);
    options.path = paths_.state / "telemetry.db";
  }
  options.sync = configuration_.store.sync;
  options.maximumBytes = configuration_.store.maximumBytes;
  options.maximumAge = configuration_.store.maximumAge;
  options.remoteBackends = configuration_.agent.remoteBackends();
  options.clock = CurrentDate;
  auto opened = TelemetryStore::open(std::move(options));
  if (!opened) {
    ZQ_LOG(nullptr, error, "the service cannot start: {}", opened.error().description());
    processExit_.exit(1);
  }
  std::shared_ptr<TelemetryStore> store = std::move(opened.value());
  DescribeInStatus(status_, store, gauges_);
  processExit_.add([store] { store->close(); });
  return store;
}

}  // namespace quarvel
