#pragma once

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Statistics/Service/ServerQueue.h"
#include "Statistics/Service/ZQReportingServiceProtocol.h"
#include "Statistics/Service/ZQReportingSession.h"
#include "Statistics/ZQReportingDriverUtility.h"
#include "base/Date.h"
#include "base/Mutex.h"
#include "base/Value.h"
#include "platform/Counters.h"
#include "platform/Notifications.h"
#include "platform/ServiceListener.h"

namespace quarvel {

class ZQReportingServerInstance;

/// The operations of the whole service that a server instance may use. Called on the `ServerQueue`.
/// Implemented by the delegate, which an instance holds weakly.
class ZQReportingServiceDelegateProtocol {
 public:
  /// The accepted clients; the list shares the ownership of each.
  using Clients = std::vector<std::shared_ptr<ZQReportingServerInstance>>;

  virtual ~ZQReportingServiceDelegateProtocol() = default;

  /// The preferences as last read; absent until the first notification of a change.
  [[nodiscard]] virtual const std::optional<Dictionary>& getDefaults()
      QUARVEL_REQUIRES(serverQueueRole) = 0;
  /// The live list, in order of acceptance.
  [[nodiscard]] virtual const Clients& getAllClients() QUARVEL_REQUIRES(serverQueueRole) = 0;
  /// The reporting switch of the preferences; on until they are read. From any thread.
  [[nodiscard]] virtual bool isReportingEnabled() = 0;
  /// The session with this identifier of the first client that has one; none for 0 and while
  /// reporting is switched off.
  [[nodiscard]] virtual std::shared_ptr<ZQReportingSession> findReportingSessionForID(
      ReporterID reporterID) QUARVEL_REQUIRES(serverQueueRole) = 0;
  /// Driver counters now, and their rise since (`ZQReportingDriverUtility`).
  /// Each takes some microseconds a channel; a driver that fails is left out.
  [[nodiscard]] virtual DriverSnapShot getSnapShot() QUARVEL_REQUIRES(serverQueueRole) = 0;
  [[nodiscard]] virtual std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(
      const std::optional<DriverSnapShot>& snapShot) QUARVEL_REQUIRES(serverQueueRole) = 0;
  /// Removes a client from the list, if it is there.
  virtual void removeClient(const ZQReportingServerInstance& client)
      QUARVEL_REQUIRES(serverQueueRole) = 0;
};

/// One client: the exported object of its connection, and the owner of its sessions.
///
/// Owned by its connection and by the delegate's client list, and by its blocks on the
/// `ServerQueue`. The protocol's operations run on the connection's thread and only queue their
/// work on the `ServerQueue`.
class ZQReportingServerInstance final
    : public ZQReportingServiceProtocol,
      public std::enable_shared_from_this<ZQReportingServerInstance> {
  struct Private {};

 public:
  /// Sessions by identifier, in ascending order.
  using SessionMap = std::map<ReporterID, std::shared_ptr<ZQReportingSession>>;

  /// For `initWithPID` alone.
  ZQReportingServerInstance(Private, std::int32_t pid,
                            std::weak_ptr<ZQReportingServiceDelegateProtocol> delegate);
  /// Drops the sessions that it still has, without stopping them.
  ~ZQReportingServerInstance() override;

  /// A new instance for the client process `pid`, which is in no list yet. `delegate` may end
  /// first: operations then find no other client and no preferences. From any thread.
  [[nodiscard]] static std::shared_ptr<ZQReportingServerInstance> initWithPID(
      std::int32_t pid, std::weak_ptr<ZQReportingServiceDelegateProtocol> delegate);

  // The operations of the protocol, whose header describes them. Each logs its entry on the
  // connection's thread, queues one block and returns; the block keeps the instance alive.

  void createReportingSession(ReporterID reporterID, BoolReply reply) override;
  void setServiceType(std::uint16_t serviceType, ReporterID reportingSession,
                      BoolReply reply) override;
  void getServiceNameForReporterID(ReporterID reporterID, ServiceTypeReply reply) override;
  void setConfiguration(std::optional<Dictionary> configuration, ReporterID reporterID,
                        BoolReply reply) override;
  void startReportingSessionForID(ReporterID reporterID, BoolReply reply) override;
  void sendMessage(std::optional<Payload> payload, std::uint32_t category, std::uint16_t type,
                   std::optional<std::vector<ReporterID>> reportingIDs, ErrorReply reply) override;
  void stopReportingSessionForID(ReporterID reporterID, BoolReply reply) override;
  void destroyReportingSession(ReporterID reporterID, BoolReply reply) override;
  void reporterID(ReporterID reporterID, DictionaryReply valid) override;
  void getAllReporters(ListReply reply) override;
  void killService(BoolReply reply) override;

  /// A session of this client or, with `acrossAllClients`, of the first other client that has it.
  [[nodiscard]] std::shared_ptr<ZQReportingSession> findReportingSessionForID(ReporterID reporterID,
                                                                              bool acrossAllClients)
      QUARVEL_REQUIRES(serverQueueRole);

  /// Called when the connection has ended: stops the client's started sessions and removes it from
  /// the client list, on the `ServerQueue`. A second call does nothing. From any thread.
  void handleConnectionError();

  /// The client's process. From any thread.
  [[nodiscard]] std::int32_t processIdentifier() const { return processIdentifier_; }
  /// The time of registration, absent before. From any thread, like the next three.
  [[nodiscard]] std::optional<Date> clientStartDate() const;
  void setClientStartDate(Date date);
  /// The process's short name; absent before the registration, or when the process has gone by
  /// then.
  [[nodiscard]] std::optional<std::string> clientProcessName() const;
  void setClientProcessName(std::optional<std::string> name);
  /// This client's sessions by identifier.
  [[nodiscard]] const SessionMap& clientReportingSessionMap() const
      QUARVEL_REQUIRES(serverQueueRole) {
    return clientReportingSessionMap_;
  }

 private:
  /// Sends `session` the rise of the driver counters since its start as a message, if there is any.
  void reportDriverStatistics(ZQReportingSession& session) QUARVEL_REQUIRES(serverQueueRole);
  /// Routes a message to the named sessions; counts a message without a session as dropped.
  void routeByIDs(const std::optional<Payload>& payload, std::uint32_t category, std::uint16_t type,
                  const std::vector<ReporterID>& reportingIDs) QUARVEL_REQUIRES(serverQueueRole);
  /// Routes a message to every started session, or sends it as a single message without one.
  void broadcast(ZQReportingServiceDelegateProtocol& delegate,
                 const std::optional<Payload>& payload, std::uint32_t category, std::uint16_t type)
      QUARVEL_REQUIRES(serverQueueRole);

  const std::int32_t processIdentifier_;
  const CountedAs counted_{Gauge::clients};
  /// Weak, since the delegate's list owns the instance.
  const std::weak_ptr<ZQReportingServiceDelegateProtocol> delegate_;

  // The delegate sets these on the `ServerQueue`; the invalidation handler reads them on a platform
  // thread.
  mutable Mutex clientMutex_;
  std::optional<Date> clientStartDate_ QUARVEL_GUARDED_BY(clientMutex_);
  std::optional<std::string> clientProcessName_ QUARVEL_GUARDED_BY(clientMutex_);

  SessionMap clientReportingSessionMap_ QUARVEL_GUARDED_BY(serverQueueRole);
};

/// Accepts every connection and keeps the list of clients, the preferences and the reporting
/// switch, through which the server instances find each other.
///
/// Owned by the listener and by its own queued blocks. Connections come on a platform thread; all
/// other work runs on the `ServerQueue`.
class ZQReportingServiceDelegate final
    : public ServiceListenerDelegate,
      public ZQReportingServiceDelegateProtocol,
      public std::enable_shared_from_this<ZQReportingServiceDelegate> {
  struct Private {};

 public:
  /// For `create` alone.
  explicit ZQReportingServiceDelegate(Private);

  /// Creates the `ServerQueue` too, and registers for changes of the preferences. Reads none yet:
  /// reporting is on until the first notification.
  [[nodiscard]] static std::shared_ptr<ZQReportingServiceDelegate> create();

  /// Accepts every connection: exports a new server instance, resumes the connection and queues the
  /// client's registration. Called on a platform thread. Returns true.
  bool shouldAcceptNewConnection(ServiceListener& listener,
                                 const std::shared_ptr<ClientConnection>& connection) override;

  // `ZQReportingServiceDelegateProtocol`

  [[nodiscard]] const std::optional<Dictionary>& getDefaults() override
      QUARVEL_REQUIRES(serverQueueRole) {
    return defaults_;
  }
  [[nodiscard]] const Clients& getAllClients() override QUARVEL_REQUIRES(serverQueueRole) {
    return clients_;
  }
  [[nodiscard]] bool isReportingEnabled() override { return reportingEnabled_; }
  [[nodiscard]] std::shared_ptr<ZQReportingSession> findReportingSessionForID(
      ReporterID reporterID) override QUARVEL_REQUIRES(serverQueueRole);
  [[nodiscard]] DriverSnapShot getSnapShot() override QUARVEL_REQUIRES(serverQueueRole) {
    return driverUtility_->getSnapShot();
  }
  [[nodiscard]] std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(
      const std::optional<DriverSnapShot>& snapShot) override QUARVEL_REQUIRES(serverQueueRole) {
    return driverUtility_->getDriverStatisticsRelativeToSnapShot(snapShot);
  }
  void removeClient(const ZQReportingServerInstance& client) override
      QUARVEL_REQUIRES(serverQueueRole);

  /// The preferences as they are now: "device_name" when there is one, and "disable_reporting".
  /// Reads the preferences domain of the service.
  [[nodiscard]] static Dictionary ZQReportingDefaults();

 private:
  /// Registers for changes of the preferences. A failure is logged and leaves the service without.
  void listenForDefaultsNotification();
  /// Reads the preferences and merges them into every session. Ignores a foreign `token`.
  void readDefaults(NotificationToken token) QUARVEL_REQUIRES(serverQueueRole);

  /// Covers the export of a server instance and the search across clients.
  RecursiveMutex lock_;
  std::atomic<bool> reportingEnabled_ = true;
  Clients clients_ QUARVEL_GUARDED_BY(serverQueueRole);
  std::optional<Dictionary> defaults_ QUARVEL_GUARDED_BY(serverQueueRole);
  NotificationToken defaultsToken_ = 0;                    // constant once notifications can come
  std::optional<ZQReportingDriverUtility> driverUtility_;  // present and constant after `create`
};

/// The short name of a client's process, if it is known: the own one for the own process, and none
/// for a process that has ended. From any thread.
[[nodiscard]] std::optional<std::string> ProcessNameForPID(std::int32_t pid);

}  // namespace quarvel
