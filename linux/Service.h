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

  [[nodiscard]] const StandardPaths& paths() const { return paths_; }
  [[nodiscard]] Log& log() { return log_; }
  [[nodiscard]] const Log& log() const { return log_; }
  [[nodiscard]] ProcessExit& processExit() { return processExit_; }
  [[nodiscard]] const Configuration& configuration() const { return configuration_; }
  [[nodiscard]] WorkQueues& queues() { return queues_; }
  [[nodiscard]] std::unique_ptr<WorkQueue>& serverQueue() { return serverQueue_; }
  [[nodiscard]] NotificationCenter& notifications() { return notifications_; }
  [[nodiscard]] PreferencesStore& preferences() { return preferences_; }
  [[nodiscard]] OrientationCenter& orientation() { return orientation_; }
  [[nodiscard]] const TallixFacility& tallix() const { return tallix_; }
  [[nodiscard]] Gauges& gauges() { return gauges_; }
  [[nodiscard]] SocketListener& listener() { return *listener_; }
  [[nodiscard]] TelemetryStore& store() { return *store_; }
  [[nodiscard]] EventQueue& events() { return events_; }
  [[nodiscard]] AnalyticsEventSink& analytics() { return analytics_; }
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

  [[nodiscard]] std::filesystem::path configurationFile() const;
  [[nodiscard]] Configuration readConfiguration();
  void setOrientationSource();
  [[nodiscard]] std::unique_ptr<SocketListener> openListener();
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
