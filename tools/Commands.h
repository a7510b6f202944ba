#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "base/Date.h"
#include "base/Error.h"

// The commands of quarvelctl. Each runs on the main thread, prints to standard output and returns
// the reason when it fails.

namespace quarvel::commands {

/// Options of every command.
struct Options {
  bool json = false;   // JSON Lines for programs instead of tables for people
  std::string socket;  // empty: where the service listens by default
  std::string store;   // empty: where the service keeps it by default
};

/// Selects rows of a table in the store.
struct RowOptions {
  std::optional<Date> since;         // rows of that time or later; none: all
  std::optional<std::int64_t> last;  // at most that many, the latest; at least 1
  bool follow = false;               // wait for further rows, without end
};

struct MessageOptions : RowOptions {
  std::optional<std::int64_t> session;  // of one session; none: of all
};

struct EventOptions : RowOptions {
  bool power = false;  // the power events instead of the analytics events
};

struct ExportOptions {
  std::int64_t last = 20;  // lines of the ledger
  bool wait = false;       // until every backlog is gone
};

/// Exactly one of the three.
struct EraseOptions {
  std::optional<std::int64_t> session;  // the rows of one session
  std::string before;                   // RFC 3339, or a day
  bool all = false;                     // every row
};

struct DefaultsOptions {
  std::string domain = "tarnwick.quarvel";  // the service's own
  std::string key;                          // of `DefaultsRead`: empty for all
  std::string value;
  bool string = false;  // the value is a string, even when it looks like a number
  bool notify = false;  // have the service read the change
};

/// The notification on which the service reads its preferences again.
inline constexpr const char* kReportingNotification = "tarnwick.quarvel.reporting";

/// Plays a script; "-" is standard input, played line by line as it arrives. A file is read whole
/// first, so that no line of a faulty file is played.
[[nodiscard]] Outcome Run(const Options& options, const std::string& file);

/// Prints the IDs of all reporting sessions that clients have.
[[nodiscard]] Outcome Reporters(const Options& options);
/// Prints a session's service type. Fails when no client has such a session.
[[nodiscard]] Outcome Valid(const Options& options, std::int64_t reporterID);
/// Ends the service; waits until its connection is closed.
[[nodiscard]] Outcome Kill(const Options& options);

/// Sessions are not followed: a session's line changes until the session ends.
[[nodiscard]] Outcome Sessions(const Options& options, const RowOptions& which);
/// Lists messages in the order of storing.
[[nodiscard]] Outcome Messages(const Options& options, const MessageOptions& which);
/// Lists analytics or power events in the order of storing.
[[nodiscard]] Outcome Events(const Options& options, const EventOptions& which);
/// Summarises the latest run of this session. Fails when the store has none.
[[nodiscard]] Outcome Summary(const Options& options, std::int64_t reporterID);

/// Lists the rows that left the device, with times, and each backend's backlog.
[[nodiscard]] Outcome Exports(const Options& options, const ExportOptions& which);
/// Removes rows from the device for good. The service does this; while none runs, and for a store
/// that the options name, the tool does.
[[nodiscard]] Outcome Erase(const Options& options, const EraseOptions& which);

/// The preferences, as the service will read them. Reading or deleting a key that has no value
/// fails.
[[nodiscard]] Outcome DefaultsRead(const Options& options, const DefaultsOptions& which);
[[nodiscard]] Outcome DefaultsWrite(const Options& options, const DefaultsOptions& which);
[[nodiscard]] Outcome DefaultsDelete(const Options& options, const DefaultsOptions& which);
/// Prints the service's status. Fails when the service does not answer, or is not healthy.
[[nodiscard]] Outcome ServiceStatus(const Options& options);

/// Posts a notification. Fails when no running service takes notifications.
[[nodiscard]] Outcome Notify(const Options& options, const std::string& name);

}  // namespace quarvel::commands
