#pragma once

#include <filesystem>
#include <memory>

#include "base/StandardPaths.h"
#include "device/DirectoryWatch.h"
#include "device/NotificationCenter.h"
#include "device/OrientationCenter.h"
#include "device/PreferencesStore.h"
#include "device/TallixFacility.h"
#include "device/VerbosePreferences.h"
#include "linux/ErasureRequests.h"
#include "linux/RemoteBackends.h"
#include "queues/WorkQueues.h"
#include "store/EventSinks.h"
#include "store/StoreStatus.h"
#include "store/TelemetryAgent.h"
#include "store/TelemetryStore.h"
#include "system/Configuration.h"
#include "system/Log.h"
#include "system/ProcessExit.h"
#include "system/ServiceManager.h"
#include "system/Status.h"
#include "transport/SocketListener.h"

namespace quarvel {

/// The whole service: its parts are members in the order in which they start, and end in reverse.
/// The platform's functions (`platform/`) find them through one pointer, since the core calls these
/// functions without a context.
///
/// One at a time in a process. Made and destroyed by the main thread, which serves clients in
/// between (`listener().resume()`). A part that cannot start ends the process with an error line
/// and status 1. The product ends by `ExitProcess` and runs no destructor: a client's work may
/// still hold threads then.
class Service {
 public:
  /// Reads the configuration, starts every part and opens store and socket; clients may connect
  /// from then on, and are served by `listener().resume()`. Blocks while the store is opened.
  Service();
  Service(const Service&) = delete;
  Service& operator=(const Service&) = delete;
  /// Runs all work to its end, commits the store's rows and ends every thread. The listener has
  /// stopped serving.
  ~Service();

  /// The running service; null when there is none. For the platform's functions alone, as is
  /// `current`.
  [[nodiscard]] static Service* running();
  /// The running service. There is one.
  [[nodiscard]] static Service& current();

  // The parts, each with threads and locks as its own header says. They live as long as the
  // service.

  /// Directories of the service, as its environment names them.
  [[nodiscard]] const StandardPaths& paths() const { return paths_; }
  [[nodiscard]] Log& log() { return log_; }
  [[nodiscard]] const Log& log() const { return log_; }
  /// Work that must be done before the process exits, and the exit itself.
  [[nodiscard]] ProcessExit& processExit() { return processExit_; }
  /// `quarvel.toml` as it was at the start.
  [[nodiscard]] const Configuration& configuration() const { return configuration_; }
  [[nodiscard]] WorkQueues& queues() { return queues_; }
  /// The queue of every server instance; null until the core makes it, once.
  [[nodiscard]] std::unique_ptr<WorkQueue>& serverQueue() { return serverQueue_; }
  /// Named notifications: files below `notify/`.
  [[nodiscard]] NotificationCenter& notifications() { return notifications_; }
  /// Preferences domains: files below `preferences/`.
  [[nodiscard]] PreferencesStore& preferences() { return preferences_; }
  /// Orientation of the device and of its user interface.
  [[nodiscard]] OrientationCenter& orientation() { return orientation_; }
  /// The configured driver counters.
  [[nodiscard]] const TallixFacility& tallix() const { return tallix_; }
  /// Counts that the core keeps, for the status file.
  [[nodiscard]] Gauges& gauges() { return gauges_; }
  /// Serves clients; its `resume` makes the caller the I/O thread.
  [[nodiscard]] SocketListener& listener() { return *listener_; }
  /// Every row of the service, and the queue in front of it.
  [[nodiscard]] TelemetryStore& store() { return *store_; }
  /// Events on their way to the store.
  [[nodiscard]] EventQueue& events() { return events_; }
  /// The sink of analytics events.
  [[nodiscard]] AnalyticsEventSink& analytics() { return analytics_; }
  /// The agent of messages and their sessions.
  [[nodiscard]] TelemetryAgent& agent() { return agent_; }

 private:
  /// Sets the pointer to the running service for its own life.
  class Running {
   public:
    explicit Running(Service& service);
    ~Running();
    Running(const Running&) = delete;
    Running& operator=(const Running&) = delete;
  };

  // Steps of the constructor; an error ends the process.

  /// `quarvel.toml` in the configuration directory; may be missing.
  [[nodiscard]] std::filesystem::path configurationFile() const;
  /// Warns about unknown keys.
  [[nodiscard]] Configuration readConfiguration();
  /// Starts the source that `[orientation]` names.
  void setOrientationSource();
  /// Takes the socket that was passed in, or listens at the path of the service.
  [[nodiscard]] std::unique_ptr<SocketListener> openListener();
  /// Opens or makes the store and starts its threads.
  [[nodiscard]] std::shared_ptr<TelemetryStore> openStore();

  const Running running_{*this};  // first: the parts below call the platform's functions
  const StandardPaths paths_;
  Log log_;
  ProcessExit processExit_{log_};
  const Configuration configuration_;
  WorkQueues queues_;
  std::unique_ptr<WorkQueue> serverQueue_;  // set by the core
  DirectoryWatch watch_;
  NotificationCenter notifications_;
  PreferencesStore preferences_;
  OrientationCenter orientation_;
  const TallixFacility tallix_;
  Gauges gauges_{};
  Status status_;
  ServiceManager manager_;
  // Before the store: a second service fails here, and never touches the store of a live one.
  const std::unique_ptr<SocketListener> listener_;
  const std::shared_ptr<TelemetryStore> store_;
  EventQueue events_;
  AnalyticsEventSink analytics_;
  TelemetryAgent agent_;
  RemoteBackends remoteBackends_;
  const ErasureRequests erasures_;
  const VerbosePreferences verbosePreferences_;
  const StatusFile statusFile_;
};

}  // namespace quarvel
