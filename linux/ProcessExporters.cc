#include "linux/ProcessExporters.h"

#include <array>
#include <chrono>
#include <memory>
#include <string>
#include <system_error>
#include <utility>
#include <vector>

#include "export/EngineModule.h"
#include "export/nats/NatsSettings.h"
#include "export/otlp/OtlpSettings.h"
#include "linux/ProcessStore.h"
#include "platform/Log.h"
#include "platform/Notifications.h"
#include "platform/WorkQueue.h"
#include "system/Configuration.h"
#include "system/ProcessExit.h"
#include "system/Status.h"

namespace quarvel {

namespace {

/// Long enough for an engine to notice; what is under way then is repeated at the next start.
constexpr std::chrono::milliseconds kEndMayTake{500};

// A new engine is one line here and one folder in export/.
constexpr std::array kRemoteBackends{
    BackendKind{"nats", ReadNatsSettings},
    BackendKind{"otlp", ReadOtlpSettings},
};

Exporters::Backend MakeBackend(const std::string& name, const Configuration::Agent& agent) {
  const BackendSettings& settings = *agent.settings.at(name);
  return {{name, agent.drainRowsPerSecond, settings.gather},
          LoadEngine(name, settings, DescribeDevice(agent.device))};
}

template <class T>
Value OrNil(const std::optional<T>& value) {
  return value ? Value(*value) : Value(nullptr);
}

Dictionary Described(const ExportThread& thread) {
  const ExportStatus status = thread.status();
  ExportSource source(*ProcessTelemetryStore(), ProcessTelemetryStore()->path(), status.backend);
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

/// As the configuration says now; as it was while it cannot be understood.
void ReadConsentAgain(Exporters& exporters) {
  ZQ_FUNCTION("ProcessExporters");
  const auto configuration = Configuration::readAgain();
  if (!configuration) {
    ZQ_LOG(nullptr, error, "{} Whether rows may leave the device stays as it was.",
           configuration.error().description());
    return;
  }
  exporters.setExports(configuration.value().agent.exports);
}

void FollowConsent(Exporters& exporters) {
  ZQ_FUNCTION("ProcessExporters");
  static WorkQueue& queue =
      *CreateSerialQueue("tarnwick.quarvel.export", QualityOfService::utility).release();
  NotificationToken token = 0;
  const std::int32_t status =
      RegisterForNotification("tarnwick.quarvel.reporting", token, queue,
                              [&exporters](NotificationToken) { ReadConsentAgain(exporters); });
  if (status != 0) {
    ZQ_LOG(nullptr, error, "whether rows may leave the device is read at the start only: {}",
           std::generic_category().message(status));
  }
}

Exporters& Started() {
  const Configuration::Agent& agent = Configuration::process().agent;
  std::vector<Exporters::Backend> backends;
  for (const std::string& name : agent.remoteBackends())
    backends.push_back(MakeBackend(name, agent));
  const bool none = backends.empty();
  auto& exporters = *new Exporters(*ProcessTelemetryStore(), std::move(backends), agent.exports);
  if (none) return exporters;
  FollowConsent(exporters);
  for (const auto& thread : exporters.threads()) {
    Status::process().addBackend([&thread] { return Described(*thread); });
  }
  AtProcessExit([&exporters] { exporters.stop(std::chrono::steady_clock::now() + kEndMayTake); });
  return exporters;
}

}  // namespace

std::span<const BackendKind> RemoteBackends() {
  return kRemoteBackends;
}

Exporters& ProcessExporters() {
  static Exporters& exporters = Started();
  return exporters;
}

}  // namespace quarvel
