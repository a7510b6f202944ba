#pragma once

#include "base/Date.h"

namespace quarvel {

/// Ends every wait in a `Condition`, of now and from now on, at `latest` if not before, as if its
/// deadline had passed.
void EndWaits(Date latest);

}  // namespace quarvel
