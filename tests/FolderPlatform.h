#pragma once

#include "queues/WorkQueues.h"

namespace quarvel::testing {

/// The queues of a test program that links FolderPlatform.cc instead of the service: those behind
/// `CreateSerialQueue`, `BackgroundQueue` and `CreateCondition`. Made on first use, never
/// destroyed.
[[nodiscard]] WorkQueues& FolderQueues();

}  // namespace quarvel::testing
