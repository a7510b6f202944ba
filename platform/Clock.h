#pragma once

#include "base/Date.h"

namespace quarvel {

/// The wall clock. May step in either direction.
[[nodiscard]] Date CurrentDate();

}  // namespace quarvel
