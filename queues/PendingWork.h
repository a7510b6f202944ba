#pragma once

#include <chrono>

namespace quarvel {

// How much work there is in the whole process: each queue that has blocks to run counts as one, and
// so does each delayed block. A queue's own blocks are what adds to the count, so once it is zero
// it stays zero until somebody outside the queues brings work.

void PendingWorkAdded();
void PendingWorkDone();

/// Waits until there is no activity. Returns false when there still was some at `deadline`.
[[nodiscard]] bool WaitUntilIdle(std::chrono::steady_clock::time_point deadline);

}  // namespace quarvel
