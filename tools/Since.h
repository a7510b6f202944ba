#pragma once

#include <optional>
#include <string_view>

#include "base/Date.h"

namespace quarvel {

/// The point in time that `--since` names: how long before `now` (a number and s, m, h, d or w, or
/// several such, the largest first: "90s", "2h", "1d12h") or RFC 3339 ("2026-01-31T14:25:00Z").
/// None when it is neither, or before all dates.
[[nodiscard]] std::optional<Date> Since(std::string_view text, Date now);

}  // namespace quarvel
