#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "base/Date.h"
#include "base/Error.h"
#include "store/database/Sqlite.h"

namespace quarvel {

// Rows of the store, as the commands print them. Plain values.

/// One agent session.
struct StoredSession {
  std::int64_t id;          // of the row; grows with each opening
  std::int64_t reporterID;  // chosen by the client, and perhaps used again
  std::int64_t clientType;
  double clientVersion;
  bool batchEvent;
  std::string hierarchyToken;
  std::string clientName;
  std::string serviceName;
  std::string userInfo;  // JSON
  Date openedAt;
  std::optional<Date> flushedAt;  // none: still open, or the service ended before
  std::int64_t messages;          // rows of this session still in the store
};

/// One message.
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

/// One analytics or power event.
struct StoredEvent {
  std::int64_t id;
  std::optional<std::int64_t> domain;  // a power event's
  std::string name;
  std::string payload;  // JSON
  Date recordedAt;
};

/// A backend with a cursor or lines in the ledger.
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

/// The service's store, opened for reading only. The service may start, write and end meanwhile.
/// Owned by the command that reads, as long as it runs; one thread.
/// Errors: domain "quarvel.store", with a reason that tells the reader how to mend it.
class StoreReader {
 public:
  /// Sessions opened at `since` or later; only the last `last` of them.
  struct SessionQuery {
    std::optional<Date> since;
    std::optional<std::int64_t> last;
  };
  /// Messages after `afterID`, sent at `since` or later, of one session; only the last `last` of
  /// them.
  struct MessageQuery {
    std::int64_t afterID = 0;
    std::optional<Date> since;
    std::optional<std::int64_t> reporterID;
    std::optional<std::int64_t> agentSession;
    std::optional<std::int64_t> last;
  };
  enum class Events { analytics, power };
  /// Events after `afterID`, recorded at `since` or later, of one name; only the last `last` of
  /// them.
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

  /// In the order of opening.
  [[nodiscard]] Outcome sessions(const SessionQuery& query,
                                 const std::function<void(StoredSession)>& each);
  /// In the order of storing.
  [[nodiscard]] Outcome messages(const MessageQuery& query,
                                 const std::function<void(StoredMessage)>& each);
  /// In the order of names. The numbers of rows are sums of the ledger, which is cut at its bound.
  [[nodiscard]] Outcome backends(const std::function<void(StoredBackend)>& each);
  /// The last lines of the ledger, the oldest first.
  [[nodiscard]] Outcome exports(std::int64_t last, const std::function<void(StoredExport)>& each);
  /// In the order of storing.
  [[nodiscard]] Outcome events(Events kind, const EventQuery& query,
                               const std::function<void(StoredEvent)>& each);

 private:
  explicit StoreReader(std::string path) : path_(std::move(path)) {}

  [[nodiscard]] Outcome connect();
  [[nodiscard]] Outcome connect(SqliteConnection::Access access);
  /// Before each query: a service may have begun to write a store that was opened as immutable.
  [[nodiscard]] Outcome reconnect();

  std::string path_;  // of the file
  SqliteConnection connection_;
  bool isImmutable_ = false;  // opened without locks, while no service wrote it
};

/// Waits for writes to a store. Owned by the command that follows rows; one thread.
class StoreWatch {
 public:
  /// `path` as `StoreReader` takes it.
  explicit StoreWatch(const std::string& path);
  ~StoreWatch();
  StoreWatch(const StoreWatch&) = delete;
  StoreWatch& operator=(const StoreWatch&) = delete;

  /// Returns soon after a write, and at the latest after a second: a row becomes readable a moment
  /// after the file has changed.
  void wait();

 private:
  const int watch_;  // an inotify descriptor, or -1
};

}  // namespace quarvel
