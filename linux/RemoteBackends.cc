#include "linux/RemoteBackends.h"

#include <chrono>
#include <memory>
#include <string>
#include <system_error>
#include <utility>
#include <vector>

#include "export/EngineModule.h"
#include "platform/Log.h"
#include "platform/Notifications.h"

namespace quarvel {

namespace {

/// Long enough for an engine to notice; a batch that is in flight is repeated at the next start.
constexpr std::chrono::milliseconds kEndMayTake{500};

std::vector<Exporters::Backend> MakeBackends(const Configuration::Agent& agent) {
  std::vector<Exporters::Backend> backends;
  for (const std::string& name : agent.remoteBackends()) {
    Exporters::Backend backend{{name, agent.drainRowsPerSecond},
                               LoadEngine(name, agent, DescribeDevice(agent.device))};
    backend.options.gather = name == "nats" ? agent.nats.gather : agent.otlp.gather;
    backends.push_back(std::move(backend));
  }
  return backends;
}

template <class T>
Value OrNil(const std::optional<T>& value) {
  return value ? Value(*value) : Value(nullptr);
}

Dictionary Describe(const ExportThread& thread, TelemetryStore& store) {
  const ExportStatus status = thread.status();
  ExportSource source(store, store.path(), status.backend);
  std::optional<std::int64_t> backlog;
  if (const auto position = source.position()) {
    if (const auto rows = source.backlog(position.value().exportedThrough)) backlog = rows.value();
  }
  return {{"name", status.backend},
          {"backlog", OrNil(backlog)},
          {"last_acknowledgement", OrNil(status.acknowledgedAt)},
          {"error", OrNil(status.error)},
          {"next_attempt", OrNil(status.nextAttempt)},
          {"exported_rows", status.exportedRows},
          {"refused_rows", status.refusedRows},
          {"wake_ups", status.wakeUps}};
}

}  // namespace

RemoteBackends::RemoteBackends(const Configuration& configuration,
                               std::filesystem::path configurationFile, TelemetryStore& store,
                               Status& status, ProcessExit& processExit)
    : configurationFile_(std::move(configurationFile)),
      exporters_(store, MakeBackends(configuration.agent), configuration.agent.exports),
      queue_(exporters_.threads().empty()
                 ? nullptr
                 : CreateSerialQueue("tarnwick.quarvel.export", QualityOfService::utility)) {
  if (queue_ == nullptr) return;
  followConsent();
  for (const auto& thread : exporters_.threads()) {
    status.addBackend([&thread, &store] { return Describe(*thread, store); });
  }
  processExit.add([this] { exporters_.stop(std::chrono::steady_clock::now() + kEndMayTake); });
}

void RemoteBackends::followConsent() {
  ZQ_FUNCTION("ProcessExporters");
  NotificationToken token = 0;
  const std::int32_t status =
      RegisterForNotification("tarnwick.quarvel.reporting", token, *queue_,
                              [this](NotificationToken) { readConsentAgain(); });
  if (status != 0) {
    ZQ_LOG(nullptr, error, "whether rows may leave the device is read at the start only: {}",
           std::generic_category().message(status));
  }
}

// A configuration that cannot be read changes nothing.
void RemoteBackends::readConsentAgain() {
  ZQ_FUNCTION("ProcessExporters");
  std::vector<std::string> warnings;  // logged at the start
  const auto configuration = Configuration::read(configurationFile_, warnings);
  if (!configuration) {
    ZQ_LOG(nullptr, error, "{} Whether rows may leave the device stays as it was.",
           configuration.error().description());
    return;
  }
  exporters_.setExports(configuration.value().agent.exports);
}

}  // namespace quarvel
