#pragma once

namespace quarvel {

/// The process entry: makes the delegate, gives it to the process's listener and serves clients
/// until the service is told to end. On the main thread. Returns the exit status of the process.
[[nodiscard]] int ServiceMain();

}  // namespace quarvel
