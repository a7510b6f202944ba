#pragma once

#include <string>

#include "base/Date.h"

namespace quarvel {

/// The wall clock. May step in either direction.
[[nodiscard]] Date CurrentDate();

/// A date as the device's local time, formatted with a pattern of `strftime`.
[[nodiscard]] std::string LocalDateText(Date date, const char* pattern);

}  // namespace quarvel
