#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "base/Date.h"
#include "tools/Commands.h"
#include "tools/Store.h"

// Texts for people: the options that the commands on the store read, and the cells that they print.
// Functions may be called from any thread.

namespace quarvel::commands {

/// The point in time that `--since` names: a duration before `now` (a number and s, m, h, d or w,
/// or several such, the largest first: "90s", "2h", "1d12h") or RFC 3339 ("2026-01-31T14:25:00Z").
/// None when it is neither, or before all dates.
[[nodiscard]] std::optional<Date> Since(std::string_view text, Date now);

/// The store that the options name, or the service's.
[[nodiscard]] std::string PathOf(const Options& options);

/// Local time without a year, since no row is kept that long.
[[nodiscard]] std::string LocalTime(Date date);
/// The duration of a session, or "not ended".
[[nodiscard]] std::string DurationOf(const StoredSession& session);
/// A service's name without the suffix "_session", which the column's heading implies.
[[nodiscard]] std::string ShownService(std::string_view name);
/// The client application that a session's user information names; empty when it names none.
[[nodiscard]] std::string ApplicationOf(const std::string& userInfo);

}  // namespace quarvel::commands
