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
#include "platform/linux/store/StoreQueue.h"

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
    /// Backends that read the store: rows they have not had are removed last.
    std::vector<std::string> remoteBackends{};
    /// Bounds of the queue; senders beyond them are held back. So few rows that under any load one
    /// is committed within 10 ms of being queued, but for a slow medium.
    std::size_t queueRows = 2048;
    std::size_t queueBytes = 8 << 20;
    /// Name of the SQLite file layer; empty: the default one.
    std::string vfs{};
    /// Says what time rows carry and how old they are; empty: the system's clock.
    std::function<Date()> clock{};
  };

  /// Opens the store, making it when there is none and setting a corrupt one aside, and starts the
  /// writer. An error says what to do; nothing has been changed then.
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

  /// Called once, on the writer's thread: be brief, and do not close the store.
  using FlushCompletion = std::function<void(const std::optional<Error>& error)>;
  /// Makes everything added before safe from a power cut and marks the session as flushed. Never
  /// held back. When this returns an error, `completion` is not called.
  Outcome flush(std::int64_t agentSession, FlushCompletion completion);

  /// Commits and syncs what was added, ends the writer and closes the file; refuses everything from
  /// now on. Returns when that is done, also when another thread began it. Rows that the disk still
  /// has no room for are lost then, and their number is logged.
  void close() QUARVEL_EXCLUDES(closing_);

  [[nodiscard]] bool isOpen() const { return !queue_.isClosed(); }
  [[nodiscard]] StoreCounters counters() const { return queue_.counters(); }

 private:
  TelemetryStore(const Options& options, std::int64_t lastAgentSession);

  const std::function<Date()> clock_;
  StoreQueue queue_;  // locks itself
  std::atomic<std::int64_t> lastAgentSession_;

  Mutex closing_;
  std::unique_ptr<StoreWriter> writer_;  // used by its thread alone while that runs
  std::thread thread_ QUARVEL_GUARDED_BY(closing_);
};

}  // namespace quarvel
