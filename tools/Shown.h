#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "base/Date.h"
#include "tools/Commands.h"
#include "tools/Store.h"

// What the commands on the store have in common.

namespace quarvel::commands {

/// The store that the options name, or the service's.
[[nodiscard]] std::string PathOf(const Options& options);

/// For people: local time; no year, since nothing is kept that long.
[[nodiscard]] std::string LocalTime(Date date);
/// How long a session ran, or that it has not ended.
[[nodiscard]] std::string DurationOf(const StoredSession& session);
/// For people, who see from the session's column what is in one.
[[nodiscard]] std::string ShownService(std::string_view name);
/// The client application that a session's user information names; empty when it names none.
[[nodiscard]] std::string ApplicationOf(const std::string& userInfo);

}  // namespace quarvel::commands
