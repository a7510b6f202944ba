#pragma once

#include <string>

#include "base/Date.h"

namespace quarvel {

/// The wall clock. May step in either direction. From any thread; never blocks.
[[nodiscard]] Date CurrentDate();

/// `date` in the device's local time, formatted with a pattern of `strftime`. From any thread.
[[nodiscard]] std::string LocalDateText(Date date, const char* pattern);

}  // namespace quarvel
