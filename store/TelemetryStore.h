#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "base/Date.h"
#include "base/Error.h"
#include "base/Mutex.h"
#include "base/Payload.h"
#include "store/StoreQueue.h"

namespace quarvel {

class StoreWriter;

/// The telemetry store: a database file that one writer thread fills from a bounded queue.
///
/// All rows queued since the last commit go into one transaction: a single row is committed at
/// once, and many rows share the cost of a commit. A committed row survives the end of the process;
/// after at most `Options::sync` it survives a power cut. While the disk is full or the database
/// fails, no accepted row is lost: the writer retries until it succeeds, and senders wait when the
/// queue is full. An idle store does nothing.
///
/// Owned by the service (shared with the objects that add rows); destroying it closes it. All
/// operations may be called from any thread. Errors have the domain "quarvel.store" and a
/// `StoreErrorCode`.
class TelemetryStore {
 public:
  struct Options {
    std::filesystem::path path{};
    /// A row is durable at most this long after it was queued; 0: with its commit.
    std::chrono::milliseconds sync{1000};
    std::uint64_t maximumBytes = 268'435'456;
    std::chrono::days maximumAge{14};
    /// How often rows past their age are looked for, when rows come. A clock that was set during
    /// this time puts the search off.
    std::chrono::milliseconds ageing{std::chrono::hours{1}};
    /// Backends that read the store: rows that one of them has not received are removed last.
    std::vector<std::string> remoteBackends{};
    /// Bounds of the queue, beyond which senders wait. So few rows that each is committed within
    /// 10 ms under any load, unless the medium is slow.
    std::size_t queueRows = 2048;
    std::size_t queueBytes = 8 << 20;
    /// How long the write-ahead log grows before it is moved into the file, in pages of 4 KiB. A
    /// longer log needs fewer syncs, but each checkpoint holds up rows for longer, and misses the
    /// system's page cache more often.
    int logPages = 1024;
    /// The delay before the first retry after a failure; it doubles up to the longest.
    std::chrono::milliseconds firstBackOff{50};
    std::chrono::milliseconds longestBackOff{5000};
    /// Gives rows their times, and retention the present; empty: the system's clock.
    std::function<Date()> clock{};
  };

  /// Opens the store and starts the writer. Makes a store when there is none, and sets a corrupt
  /// one aside. An error tells the remedy, and nothing has been changed then. A failure that may
  /// pass, such as a full disk, is no error: rows wait in the queue until the file can be opened.
  [[nodiscard]] static Result<std::unique_ptr<TelemetryStore>> open(Options options);
  TelemetryStore(const TelemetryStore&) = delete;
  TelemetryStore& operator=(const TelemetryStore&) = delete;
  ~TelemetryStore();

  struct AgentSession {
    std::int64_t sessionID = 0;
    std::int64_t clientType = 0;
    double clientVersion = 0;  // finite
    bool batchEvent = false;
    std::string_view hierarchyToken{}, clientName{}, serviceName{};
    const Payload& userInfo;
  };
  /// Adds a session and returns its id. Never waits.
  [[nodiscard]] Result<std::int64_t> addAgentSession(const AgentSession& session);

  struct Message {
    std::optional<std::int64_t> agentSession;  // none: a message of no session
    std::int64_t sessionID = 0;
    std::string_view clientName{}, serviceName{};
    std::uint16_t category = 0;
    std::uint16_t type = 0;
    const Payload& payload;
  };
  // Success means that the row is queued and will be kept. Waits while there is no room.
  Outcome addMessage(const Message& message);
  Outcome addAnalyticsEvent(std::string_view name, const Payload& payload);
  Outcome addPowerEvent(std::int32_t domain, std::string_view name, const Payload& payload);
  // The same, but without waiting: false, with nothing done, while there is no room.
  [[nodiscard]] bool addAnalyticsEventIfRoom(std::string_view name, const Payload& payload);
  [[nodiscard]] bool addPowerEventIfRoom(std::int32_t domain, std::string_view name,
                                         const Payload& payload);

  /// Called once, on the writer's thread: be brief, and do not close the store.
  using FlushCompletion = std::function<void(const std::optional<Error>& error)>;
  /// Makes everything added before durable and marks the session as flushed. Never waits. When this
  /// returns an error, `completion` is not called.
  Outcome flush(std::int64_t agentSession, FlushCompletion completion);

  /// Records a delivery to a backend; `completion` as for `flush`. Never waits. A record about
  /// another store, one that was set aside meanwhile, has no effect.
  Outcome addExport(ExportRecord record, FlushCompletion completion);
  /// Removes for good rows that were added before, as `Erasure`; all of them: also the stores that
  /// were set aside. `completion` gets their number, or the reason why the erasure was not
  /// finished; otherwise as for `flush`. Never waits.
  Outcome erase(ErasureSelection selection,
                std::function<void(const Result<std::int64_t>&)> completion);
  /// Calls `follower` now and whenever more rows have become durable, on the writer's thread and
  /// under a lock: be brief, and call no function of the store. Replaces the follower before, which
  /// is not called any more once this returns. An empty one ends the calls.
  void followDurableExtent(std::function<void(const DurableExtent&)> follower);

  /// Refuses further rows, commits and syncs those added before, ends the writer and closes the
  /// file. Returns when that is done, also when another thread began it. Rows for which the disk
  /// still has no room are lost, and their number is logged.
  void close() QUARVEL_EXCLUDES(closing_);

  // Messages before they are added: counted from acceptance on, so that none is lost uncounted.
  void countAccepted() { queue_.countAccepted(); }
  void countQueued() { queue_.countQueued(); }
  void countDropped(StoreDrop reason) { queue_.countDropped(reason); }

  [[nodiscard]] bool isOpen() const { return !queue_.isClosed(); }
  [[nodiscard]] StoreCounters counters() const { return queue_.counters(); }

  struct State {
    std::size_t queuedRows = 0;
    std::size_t queuedBytes = 0;
    std::optional<std::string> problem;  // why rows have to wait now
  };
  [[nodiscard]] State state() const;
  [[nodiscard]] const std::filesystem::path& path() const { return path_; }

 private:
  TelemetryStore(const Options& options, std::int64_t lastAgentSession);

  const std::filesystem::path path_;
  const std::function<Date()> clock_;
  StoreQueue queue_;  // locks itself
  std::atomic<std::int64_t> lastAgentSession_;

  Mutex closing_;
  std::unique_ptr<StoreWriter> writer_;  // constant after construction; runs on `thread_`
  std::thread thread_ QUARVEL_GUARDED_BY(closing_);
};

}  // namespace quarvel
