#include "linux/ProcessStore.h"

#include <utility>

#include "base/Files.h"
#include "base/StandardPaths.h"
#include "platform/Clock.h"
#include "platform/Log.h"
#include "platform/Process.h"
#include "store/StoreStatus.h"
#include "system/Configuration.h"
#include "system/ProcessExit.h"

namespace quarvel {

namespace {

std::shared_ptr<TelemetryStore> OpenOrExit() {
  ZQ_FUNCTION("ProcessTelemetryStore");
  const Configuration& configuration = Configuration::process();
  TelemetryStore::Options options;
  options.path = configuration.store.path;
  if (options.path.empty()) {
    // The state directory is the service's own to make; one that somebody named is not.
    (void)CreatePrivateDirectory(StandardPaths::process().state);
    options.path = StandardPaths::process().state / "telemetry.db";
  }
  options.sync = configuration.store.sync;
  options.maximumBytes = configuration.store.maximumBytes;
  options.maximumAge = configuration.store.maximumAge;
  options.remoteBackends = configuration.agent.remoteBackends();
  options.clock = CurrentDate;
  auto store = TelemetryStore::open(std::move(options));
  if (!store) {
    ZQ_LOG(nullptr, error, "the service cannot start: {}", store.error().description());
    ExitProcess(1);
  }
  return std::move(store.value());
}

}  // namespace

const std::shared_ptr<TelemetryStore>& ProcessTelemetryStore() {
  static const auto& store = *[] {
    const auto* opened = new std::shared_ptr<TelemetryStore>(OpenOrExit());
    DescribeInStatus(Status::process(), *opened);
    AtProcessExit([opened] { (*opened)->close(); });
    return opened;
  }();
  return store;
}

EventQueue& ProcessEventQueue() {
  static EventQueue& path = *new EventQueue(ProcessTelemetryStore());
  return path;
}

}  // namespace quarvel
