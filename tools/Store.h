#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/Date.h"
#include "base/Error.h"

struct sqlite3;

namespace quarvel {

/// One agent session in the store.
struct StoredSession {
  std::int64_t id;
  std::int64_t reporterID;
  std::int64_t clientType;
  double clientVersion;
  bool batchEvent;
  std::string hierarchyToken;
  std::string clientName;
  std::string serviceName;
  std::string userInfo;  // JSON
  Date openedAt;
  std::optional<Date> flushedAt;  // none: still open, or the service ended before
  std::int64_t messages;
};

/// One message in the store.
struct StoredMessage {
  std::int64_t id;
  std::optional<std::int64_t> agentSession;  // none: a single message
  std::int64_t reporterID;                   // -1 for a single message
  std::string serviceName;
  std::uint16_t category;
  std::uint16_t type;
  std::string payload;  // JSON
  Date sentAt;
};

/// One analytics or power event in the store.
struct StoredEvent {
  std::int64_t id;
  std::optional<std::int64_t> domain;  // a power event's
  std::string name;
  std::string payload;  // JSON
  Date recordedAt;
};

/// A backend that has been given rows, or that was refused some.
struct StoredBackend {
  std::string name;
  std::int64_t backlog = 0;  // rows
  std::int64_t exported = 0;
  std::int64_t refused = 0;
  std::optional<Date> acknowledgedAt;
};

/// A line of the ledger: rows that left the device, that an engine refused, or that were erased.
struct StoredExport {
  std::int64_t id;
  std::string backend;  // "store": erased
  std::string table;
  std::optional<std::int64_t> firstID, lastID;
  std::int64_t rows;
  std::int64_t bytes;
  std::string outcome;
  Date at;
};

/// The service's store, opened for reading only; it may be written meanwhile, and the service may
/// start and end. For one thread.
/// Errors: domain "quarvel.store", with a reason that says what to do.
class StoreReader {
 public:
  /// Which sessions: opened at `since` or later, and only the last so many of them.
  struct SessionQuery {
    std::optional<Date> since;
    std::optional<std::int64_t> last;
  };
  /// Which messages: after `afterID`, sent at `since` or later, of one session, and only the last
  /// so many of them.
  struct MessageQuery {
    std::int64_t afterID = 0;
    std::optional<Date> since;
    std::optional<std::int64_t> reporterID;
    std::optional<std::int64_t> agentSession;
    std::optional<std::int64_t> last;
  };
  enum class Events { analytics, power };
  /// Which events: after `afterID`, recorded at `since` or later, of one name, and only the last so
  /// many of them.
  struct EventQuery {
    std::int64_t afterID = 0;
    std::optional<Date> since;
    std::optional<std::string> name;
    std::optional<std::int64_t> last;
  };

  /// telemetry.db in the first directory that has one of `$STATE_DIRECTORY`,
  /// `$XDG_STATE_HOME/quarvel` or ~/.local/state/quarvel (not for root) and /var/lib/quarvel. When
  /// none has: in /var/lib/quarvel if this user may not look there, else in the first.
  [[nodiscard]] static std::string defaultPath();
  /// Takes the file, or the directory that holds telemetry.db.
  [[nodiscard]] static Result<StoreReader> open(std::string path);

  /// In the order in which they were opened.
  [[nodiscard]] Outcome sessions(const SessionQuery& query,
                                 const std::function<void(StoredSession)>& each);
  /// In the order in which they were stored.
  [[nodiscard]] Outcome messages(const MessageQuery& query,
                                 const std::function<void(StoredMessage)>& each);
  /// By their names. The rows that were given are those of the ledger, which ends somewhere.
  [[nodiscard]] Outcome backends(const std::function<void(StoredBackend)>& each);
  /// The last lines of the ledger, the oldest first.
  [[nodiscard]] Outcome exports(std::int64_t last, const std::function<void(StoredExport)>& each);
  /// In the order in which they were stored.
  [[nodiscard]] Outcome events(Events kind, const EventQuery& query,
                               const std::function<void(StoredEvent)>& each);

 private:
  struct Close {
    void operator()(sqlite3* database) const;
  };
  explicit StoreReader(std::string path) : path_(std::move(path)) {}

  [[nodiscard]] Outcome connect();
  [[nodiscard]] Outcome connect(bool atRest);
  /// Before each query: a store that was at rest may have come to life.
  [[nodiscard]] Outcome reconnect();

  std::string path_;
  std::unique_ptr<sqlite3, Close> database_;
  bool atRest_ = false;  // opened as a file that nobody writes
};

/// Wakes when something is written to a store.
class StoreWatch {
 public:
  /// `path` as `StoreReader` takes it.
  explicit StoreWatch(const std::string& path);
  ~StoreWatch();
  StoreWatch(const StoreWatch&) = delete;
  StoreWatch& operator=(const StoreWatch&) = delete;

  /// Returns soon after a write, and at the latest after a second: rows can be read only a moment
  /// after the file has changed.
  void wait();

 private:
  const int watch_;  // an inotify descriptor, or -1
};

}  // namespace quarvel
