#pragma once

#include <chrono>

namespace quarvel {

// What the service manager that started the process (systemd) is told, over the socket that it
// named in `$NOTIFY_SOCKET`. Without one each of these does nothing. Any thread.

/// Clients are served.
void TellManagerReady();
/// The service ends, in order.
void TellManagerStopping();

/// How often the manager wants to hear that the process is alive: half of what it would wait
/// (`$WATCHDOG_USEC`), so that one ping may be late. Zero: never.
[[nodiscard]] std::chrono::microseconds ManagerPingInterval();
/// Tells the manager so as soon as the work of clients moves: a block of their urgency has to get
/// its turn. Work that waits for room in the store lends its place and does not hold the ping up;
/// work that hangs does.
void PingManager();

}  // namespace quarvel
