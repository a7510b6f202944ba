#pragma once

#include "base/Block.h"

namespace quarvel {

/// Has `work` run when the process ends through `ExitProcess`: once, on the thread that ends it,
/// the last registered first, and before the log is flushed. It must come to an end by itself,
/// soon, and may still log. What ends in order (`exit`) does not come this way.
void AtProcessExit(Block work);

}  // namespace quarvel
