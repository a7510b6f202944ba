#pragma once

namespace quarvel {

/// Ends every wait in a `Condition`, now and from now on, as if its deadline had passed.
void EndWaits();

}  // namespace quarvel
