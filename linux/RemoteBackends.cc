#include "linux/RemoteBackends.h"

#include <array>
#include <chrono>
#include <memory>
#include <string>
#include <system_error>
#include <utility>
#include <vector>

#include "export/ExportEngine.h"
#include "export/nats/NatsSettings.h"
#include "export/otlp/OtlpSettings.h"
#include "platform/Log.h"
#include "platform/Notifications.h"

namespace quarvel {

namespace {

/// Long enough for an engine to notice; a batch that is in flight is repeated at the next start.
constexpr std::chrono::milliseconds kEndMayTake{500};

// A new engine is one line here and one folder in export/.
constexpr std::array kBackendKinds{
    BackendKind{"nats", ReadNatsSettings},
    BackendKind{"otlp", ReadOtlpSettings},
};

std::vector<Exporters::Backend> MakeBackends(const Configuration::Agent& agent) {
  std::vector<Exporters::Backend> backends;
  for (const std::string& name : agent.remoteBackends()) {
    const BackendSettings& settings = *agent.settings.at(name);
    backends.push_back({{name, agent.drainRowsPerSecond, settings.gather},
                        LoadEngine(name, settings, DescribeDevice(agent.device))});
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

std::span<const BackendKind> RemoteBackends::kinds() {
  return kBackendKinds;
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
  const auto configuration = Configuration::read(configurationFile_, kinds(), warnings);
  if (!configuration) {
    ZQ_LOG(nullptr, error, "{} Whether rows may leave the device stays as it was.",
           configuration.error().description());
    return;
  }
  exporters_.setExports(configuration.value().agent.exports);
}

}  // namespace quarvel
