#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "Statistics/Service/PayloadHistory.h"
#include "Statistics/Service/ServerQueue.h"
#include "Statistics/SharedDictionary.h"
#include "Statistics/ZQReportingDriverUtility.h"
#include "Statistics/ZQReportingUtility.h"
#include "base/Error.h"
#include "base/Mutex.h"
#include "base/Payload.h"
#include "platform/Counters.h"
#include "platform/RelmReporting.h"
#include "platform/Reply.h"
#include "platform/WorkQueue.h"

namespace quarvel {

/// One client's reporting session. While it is started, its messages go to the telemetry agent
/// inside an agent session; before and after, each goes as a single message. A stop sends a summary
/// and answers the client's start call.
///
/// Owned by the session map of its server instance and by its queued blocks. Every operation is
/// called on the `ServerQueue` and returns at once; all work with the agent runs on the session's
/// own serial queue, in order. Dropping a session neither stops it nor loses queued messages.
class ZQReportingSession : public std::enable_shared_from_this<ZQReportingSession> {
  struct Private {};

 public:
  /// Called with the agent's error, or none.
  using SendReply = std::function<void(const std::optional<Error>& error)>;

  /// For `initWithID` alone.
  ZQReportingSession(Private, ReporterID reporterID, std::vector<std::int32_t> processIdentifiers);
  /// From any thread: the last reference may be a queued block's.
  ~ZQReportingSession();
  ZQReportingSession(const ZQReportingSession&) = delete;
  ZQReportingSession& operator=(const ZQReportingSession&) = delete;

  /// A new session, owned by the client processes `processIdentifiers`. From any thread.
  [[nodiscard]] static std::shared_ptr<ZQReportingSession> initWithID(
      ReporterID reporterID, std::vector<std::int32_t> processIdentifiers);

  /// Takes effect for messages from now on; an agent session that exists keeps its service name.
  void setServiceType(std::uint16_t serviceType) QUARVEL_REQUIRES(serverQueueRole);
  /// Merges into the user information, in which keys are never removed; an absent dictionary
  /// changes nothing.
  void setConfiguration(const std::optional<Dictionary>& configuration);
  /// The same with the preferences as they were read.
  void updateDefaults(const std::optional<Dictionary>& defaults);

  /// Begins an agent session, for whose backends the session queue waits up to 9 seconds. Does
  /// nothing when it is already started.
  void start() QUARVEL_REQUIRES(serverQueueRole);
  /// Sends the summary, flushes and ends the agent session and answers the start call
  /// (`transactionCompleteBlock`). Does nothing when it is not started.
  void stop() QUARVEL_REQUIRES(serverQueueRole);

  /// Counts a message and returns its identifier, "category_type_n".
  [[nodiscard]] std::string messageIdForCategory(std::uint32_t category, std::uint16_t type)
      QUARVEL_REQUIRES(serverQueueRole);

  /// Records the message and delivers it on the session queue. `reply` is called at once, without
  /// an error; `sync` has no effect, so the outcome of the delivery never reaches the caller. An
  /// absent payload counts as an empty one.
  void sendMessage(const std::optional<Payload>& payload, std::uint32_t category,
                   std::uint16_t type, bool sync, const SendReply& reply)
      QUARVEL_REQUIRES(serverQueueRole);
  void sendMessage(const std::optional<Payload>& payload, std::uint32_t category,
                   std::uint16_t type, const SendReply& reply) QUARVEL_REQUIRES(serverQueueRole);

  /// Hands one message that belongs to no session to the agent, on the background queue: at once,
  /// or for alarms after 0 to 59 seconds, so that the alarms of many devices spread over a minute.
  /// `userInfo` has no effect. `reply` is called on that queue. From any thread.
  static void sendSingleMessage(const std::optional<Payload>& payload, std::uint32_t category,
                                std::uint16_t type, std::uint16_t serviceType,
                                const std::optional<Dictionary>& userInfo, SendReply reply);

  /// Condenses the history into one dictionary of texts, each key's values joined by ",". Inserts
  /// the user information at the front of the history and, on an internal build, writes the history
  /// as a JSON file in the diagnostics directory. None when the history is empty.
  [[nodiscard]] std::optional<Payload> createSummaryEventForSession()
      QUARVEL_REQUIRES(serverQueueRole);
  /// Whether orientation changes go into the history: on internal builds, for two service types,
  /// and not on one class of device.
  [[nodiscard]] bool shouldReportOrientation() const;

  // Without a queue in their declaration: from any thread.

  /// The client's identifier; other clients may use the same one.
  [[nodiscard]] ReporterID reporterID() const { return reporterID_; }
  [[nodiscard]] const std::vector<std::int32_t>& processIdentifiers() const {
    return processIdentifiers_;
  }
  /// Whether a start has not been followed by a stop.
  [[nodiscard]] bool started() const QUARVEL_REQUIRES(serverQueueRole) { return started_; }
  /// Never true: nothing sets it.
  [[nodiscard]] bool relmReportingSessionStarted() const { return relmReportingSessionStarted_; }
  /// The code last set, any number; `kServiceTypeUnknown` before.
  [[nodiscard]] std::uint16_t serviceType() const { return serviceType_; }
  /// The service type's name: "unknown" before one is set, empty for a code that has none.
  [[nodiscard]] const std::string& serviceName() const QUARVEL_REQUIRES(serverQueueRole) {
    return serviceName_;
  }
  /// The live user information, valid while the session lives.
  [[nodiscard]] const SharedDictionary& userInfo() const { return *userInfo_; }
  /// The history of this run; null after a stop. From any thread.
  [[nodiscard]] std::shared_ptr<PayloadHistory> aggregatedPayloadData() const;
  /// Driver counters at the start. Kept for the server instance; the session does not read them.
  [[nodiscard]] const std::optional<DriverSnapShot>& driverSnapShot() const
      QUARVEL_REQUIRES(serverQueueRole) {
    return driverSnapShot_;
  }
  void setDriverSnapShot(std::optional<DriverSnapShot> snapShot) QUARVEL_REQUIRES(serverQueueRole) {
    driverSnapShot_ = std::move(snapShot);
  }
  /// The client's start reply, which the stop answers.
  [[nodiscard]] const BoolReply& transactionCompleteBlock() const
      QUARVEL_REQUIRES(serverQueueRole) {
    return transactionCompleteBlock_;
  }
  void setTransactionCompleteBlock(BoolReply block) QUARVEL_REQUIRES(serverQueueRole) {
    transactionCompleteBlock_ = std::move(block);
  }
  /// Appends "<ZQReportingSession 7>", for log lines.
  static void appendDescription(std::string& text, ReporterID reporterID);

 private:
  /// The pieces of a category's and a type's names: component, kind, type.
  using MessageName = std::array<std::string_view, 3>;

  /// Counts a message and returns its identity.
  [[nodiscard]] MessageIdentity nextIdentity(std::uint32_t category, std::uint16_t type)
      QUARVEL_REQUIRES(serverQueueRole);
  // On the session's queue.

  /// Creates the agent session and waits for its backends; drops it when none is found in time.
  void setUpAgent(const SharedDictionary& userInfo, const std::string& serviceName,
                  bool backendFound);
  /// Hands a message to the agent. `wasStarted`: the session's state at the sending, which chooses
  /// between the agent session and a single message.
  void deliver(const Payload& enriched, std::uint32_t category, std::uint16_t type,
               const Payload& original, bool wasStarted);
  /// Flushes and releases the agent session.
  void endAgent();

  // On the `ServerQueue`.

  /// Counts one message of this session, client's or summary, as accepted.
  void acceptMessage() const;
  /// Sends the summary of a run that has a history.
  void sendSummary() QUARVEL_REQUIRES(serverQueueRole);
  /// Adds orientation changes to the history until `unregisterOrientationHandlers`, which waits for
  /// a handler that is running.
  void registerOrientationHandlers() QUARVEL_REQUIRES(serverQueueRole);
  void unregisterOrientationHandlers() QUARVEL_REQUIRES(serverQueueRole);
  /// Writes `history` as a JSON file into the diagnostics directory. Failures are logged.
  void writeSummaryLogFile(const PayloadHistory& history) const;
  void setAggregatedPayloadData(std::shared_ptr<PayloadHistory> history);

  const ReporterID reporterID_;
  const std::vector<std::int32_t> processIdentifiers_;
  const CountedAs counted_{Gauge::sessions};

  std::optional<CountedAs> countedAsStarted_ QUARVEL_GUARDED_BY(serverQueueRole);
  bool started_ QUARVEL_GUARDED_BY(serverQueueRole) = false;
  std::string serviceName_ QUARVEL_GUARDED_BY(serverQueueRole) = "unknown";
  /// Continues across a stop and a new start. A vector, since a session's messages have few names.
  std::vector<std::pair<MessageName, std::uint64_t>> messageCounts_
      QUARVEL_GUARDED_BY(serverQueueRole);
  std::optional<DriverSnapShot> driverSnapShot_ QUARVEL_GUARDED_BY(serverQueueRole);
  std::optional<std::string> orientationCallbackID_ QUARVEL_GUARDED_BY(serverQueueRole);
  BoolReply transactionCompleteBlock_ QUARVEL_GUARDED_BY(serverQueueRole);

  // Written on one queue and read on the other: atomic instead of guarded.
  std::atomic<std::uint16_t> serviceType_ = kServiceTypeUnknown;
  std::atomic<bool> relmReportingSessionStarted_ = false;

  /// Shared with the agent set-up deliberately: it sees merges that precede its run.
  const std::shared_ptr<SharedDictionary> userInfo_ = std::make_shared<SharedDictionary>();

  // The `ServerQueue` replaces it; orientation handlers read it on a platform thread.
  mutable Mutex historyMutex_;
  std::shared_ptr<PayloadHistory> aggregatedPayloadData_ QUARVEL_GUARDED_BY(historyMutex_);

  const std::unique_ptr<WorkQueue> relmReportingQueue_;
  std::shared_ptr<RelmReportingSession> relmReportingSession_
      QUARVEL_GUARDED_BY(relmReportingQueue_);
  std::optional<RelmReportingToken> relmReportingAgentToken_
      QUARVEL_GUARDED_BY(relmReportingQueue_);
};

}  // namespace quarvel
