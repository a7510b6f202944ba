#pragma once

#include <filesystem>
#include <memory>
#include <span>

#include "export/Exporters.h"
#include "platform/WorkQueue.h"
#include "system/Configuration.h"
#include "system/ProcessExit.h"
#include "system/Status.h"

namespace quarvel {

/// The exporters of the configured remote backends, one thread each. They follow `[agent] export`,
/// which is read again with the preferences. Owned by the service, and outlives the blocks of its
/// queue.
class RemoteBackends {
 public:
  /// Starts the exporters. `configurationFile` is the file that `configuration` was read from. They
  /// stop in `processExit`; `store`, `status` and `processExit` outlive this.
  RemoteBackends(const Configuration& configuration, std::filesystem::path configurationFile,
                 TelemetryStore& store, Status& status, ProcessExit& processExit);
  RemoteBackends(const RemoteBackends&) = delete;
  RemoteBackends& operator=(const RemoteBackends&) = delete;

  /// The engines that the service knows, for its configuration. Constant.
  [[nodiscard]] static std::span<const BackendKind> kinds();

  /// The exporters that were started; may be none. Any thread.
  [[nodiscard]] Exporters& exporters() { return exporters_; }

 private:
  /// Has the consent read again at each change of the preferences.
  void followConsent();
  /// On `queue_`: reads `[agent] export` from the configuration file and passes it to the
  /// exporters.
  void readConsentAgain();

  const std::filesystem::path configurationFile_;
  Exporters exporters_;
  const std::unique_ptr<WorkQueue> queue_;  // null without backends
};

}  // namespace quarvel
