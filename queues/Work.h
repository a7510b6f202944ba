#pragma once

#include <chrono>

namespace quarvel {

/// Brings all work to an end, for the end of the service: blocks that wait for a delay run at once,
/// waits in a `Condition` end within two seconds as if their deadline had passed, and the caller
/// (no worker thread) waits until every queue is idle. Returns false when that was not so at
/// `deadline`.
[[nodiscard]] bool DrainWork(std::chrono::steady_clock::time_point deadline);

}  // namespace quarvel
