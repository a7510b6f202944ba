#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "base/Date.h"
#include "base/Error.h"

// What quarvelctl does. Each prints to standard output and returns why it could not.

namespace quarvel::commands {

struct Options {
  bool json = false;   // JSON Lines for programs instead of tables for people
  std::string socket;  // empty: where the service listens by default
  std::string store;   // empty: where the service keeps it by default
};

/// Which rows of a table in the store.
struct RowOptions {
  std::optional<Date> since;
  std::optional<std::int64_t> last;
  bool follow = false;  // go on with those that come, for ever
};

struct MessageOptions : RowOptions {
  std::optional<std::int64_t> session;
};

struct EventOptions : RowOptions {
  bool power = false;  // the power events instead of the analytics events
};

struct ExportOptions {
  std::int64_t last = 20;
  bool wait = false;  // until every backlog is gone
};

/// Exactly one of the three.
struct EraseOptions {
  std::optional<std::int64_t> session;
  std::string before;  // RFC 3339, or a day
  bool all = false;
};

struct DefaultsOptions {
  std::string domain = "tarnwick.quarvel";
  std::string key;  // of `DefaultsRead`: empty for all
  std::string value;
  bool string = false;  // the value is a string, whatever it looks like
  bool notify = false;  // have the service read the change
};

inline constexpr const char* kReportingNotification = "tarnwick.quarvel.reporting";

/// Plays a script; "-" is standard input, each line of which is played as it comes. A file is read
/// whole first, so that nothing is played of one that has a fault.
[[nodiscard]] Outcome Run(const Options& options, const std::string& file);

[[nodiscard]] Outcome Reporters(const Options& options);
/// Fails when no client has such a session.
[[nodiscard]] Outcome Valid(const Options& options, std::int64_t reporterID);
[[nodiscard]] Outcome Kill(const Options& options);

/// Sessions are not followed: what is told of one changes until it ends.
[[nodiscard]] Outcome Sessions(const Options& options, const RowOptions& which);
[[nodiscard]] Outcome Messages(const Options& options, const MessageOptions& which);
[[nodiscard]] Outcome Events(const Options& options, const EventOptions& which);
/// What the latest run of this session was. Fails when the store has none.
[[nodiscard]] Outcome Summary(const Options& options, std::int64_t reporterID);

/// What left the device and when, and how far each backend is.
[[nodiscard]] Outcome Exports(const Options& options, const ExportOptions& which);
/// Removes rows from the device for good: the service does so, or while there is none, and for a
/// store that the options name, this does.
[[nodiscard]] Outcome Erase(const Options& options, const EraseOptions& which);

/// The preferences, as the service will read them. Reading or deleting a key that has no value
/// fails.
[[nodiscard]] Outcome DefaultsRead(const Options& options, const DefaultsOptions& which);
[[nodiscard]] Outcome DefaultsWrite(const Options& options, const DefaultsOptions& which);
[[nodiscard]] Outcome DefaultsDelete(const Options& options, const DefaultsOptions& which);
/// Tells how the service is. Fails when it does not answer, or is not well.
[[nodiscard]] Outcome ServiceStatus(const Options& options);

/// Posts a notification. Fails when no service is there that takes one.
[[nodiscard]] Outcome Notify(const Options& options, const std::string& name);

}  // namespace quarvel::commands
