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

/// Where everything ends up: a database file that one writer thread fills from a bounded queue.
///
/// Everything queued since the last commit goes into one transaction, so that a row alone is
/// committed at once and many rows share the cost of a commit. A committed row survives the end of
/// the process; after at most `Options::sync` it survives a power cut. While the disk is full or
/// the database fails, nothing that was taken is lost: the writer tries again until it succeeds,
/// and senders wait when the queue is full. An idle store does nothing.
///
/// All operations may be called from any thread. Errors have the domain "quarvel.store" and a
/// `StoreErrorCode`.
class TelemetryStore {
 public:
  struct Options {
    std::filesystem::path path{};
    /// A row is on the medium at most this long after it was queued; 0: with its commit.
    std::chrono::milliseconds sync{1000};
    std::uint64_t maximumBytes = 268'435'456;
    std::chrono::days maximumAge{14};
    /// How often, when rows come, old ones are looked for; until then the clock must have run on
    /// without being set.
    std::chrono::milliseconds ageing{std::chrono::hours{1}};
    /// Backends that read the store: rows they have not had are removed last.
    std::vector<std::string> remoteBackends{};
    /// Bounds of the queue; senders beyond them are held back. So few rows that under any load one
    /// is committed within 10 ms of being queued, but for a slow medium.
    std::size_t queueRows = 2048;
    std::size_t queueBytes = 8 << 20;
    /// How far the write-ahead log grows before it is moved into the file, in pages of 4 KiB. A
    /// longer log needs fewer syncs, but what is moved at once holds up the rows behind it, and
    /// pages that the system has cached are cheaper than new ones.
    int logPages = 1024;
    /// How long the writer waits before it tries again what failed; doubles up to 5 s.
    std::chrono::milliseconds firstBackOff{50};
    /// Says what time rows carry and how old they are; empty: the system's clock.
    std::function<Date()> clock{};
  };

  /// Opens the store, making it when there is none and setting a corrupt one aside, and starts the
  /// writer. An error says what to do; nothing has been changed then. What may pass, such as a full
  /// disk, is none: rows wait in the queue until the file can be opened.
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
  /// Adds a session and returns its id. Never held back.
  [[nodiscard]] Result<std::int64_t> addAgentSession(const AgentSession& session);

  struct Message {
    std::optional<std::int64_t> agentSession;  // none: a message of no session
    std::int64_t sessionID = 0;
    std::string_view clientName{}, serviceName{};
    std::uint16_t category = 0;
    std::uint16_t type = 0;
    const Payload& payload;
  };
  // Success means that the row is queued and will be kept. Held back while there is no room.
  Outcome addMessage(const Message& message);
  Outcome addAnalyticsEvent(std::string_view name, const Payload& payload);
  Outcome addPowerEvent(std::int32_t domain, std::string_view name, const Payload& payload);
  // As these two, but false, with nothing done, while there is no room.
  [[nodiscard]] bool addAnalyticsEventIfRoom(std::string_view name, const Payload& payload);
  [[nodiscard]] bool addPowerEventIfRoom(std::int32_t domain, std::string_view name,
                                         const Payload& payload);

  /// Called once, on the writer's thread: be brief, and do not close the store.
  using FlushCompletion = std::function<void(const std::optional<Error>& error)>;
  /// Makes everything added before safe from a power cut and marks the session as flushed. Never
  /// held back. When this returns an error, `completion` is not called.
  Outcome flush(std::int64_t agentSession, FlushCompletion completion);

  /// Records what a backend has been given; `completion` as for `flush`. Never held back. A record
  /// about another store than this, which was set aside meanwhile, has no effect.
  Outcome addExport(ExportRecord record, FlushCompletion completion);
  /// Removes rows for good: of those that were added before, as `Erasure`. `completion` gets
  /// how many they were, or why it was not finished; else as for `flush`. Never held back.
  Outcome erase(ErasureSelection selection,
                std::function<void(const Result<std::int64_t>&)> completion);
  /// `follower` is told at once and whenever more has become safe from a power cut, on the writer's
  /// thread, under a lock: be brief, and call nothing of the store. An empty one ends that; once
  /// this returns, the earlier one is not called any more.
  void followDurableExtent(std::function<void(const DurableExtent&)> follower);

  /// Commits and syncs what was added, ends the writer and closes the file; refuses everything from
  /// now on. Returns when that is done, also when another thread began it. Rows that the disk still
  /// has no room for are lost then, and their number is logged.
  void close() QUARVEL_EXCLUDES(closing_);

  // Messages before they are added: counted from their acceptance on, so that none disappears.
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
  std::unique_ptr<StoreWriter> writer_;  // used by its thread alone while that runs
  std::thread thread_ QUARVEL_GUARDED_BY(closing_);
};

}  // namespace quarvel
