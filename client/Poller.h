#pragma once

#include <chrono>
#include <optional>

#include "base/Error.h"

namespace quarvel {

/// One descriptor for all events of a connection: input on its socket, a wake-up from another
/// thread, a point in time. It is readable while one of them is due. Owned by the channel and lives
/// as long. `wait` and `arm` are for the driver's thread; the other functions may be called from
/// every thread.
class Poller {
 public:
  using Time = std::chrono::steady_clock::time_point;

  /// The events that ended a wait.
  struct Events {
    bool input = false;  // bytes to read, or the end of the connection
    bool timer = false;  // the armed time has come
  };

  Poller();
  ~Poller();
  Poller(const Poller&) = delete;
  Poller& operator=(const Poller&) = delete;

  /// 0, or `errno` of the failure to create the descriptors.
  [[nodiscard]] int error() const { return error_; }
  /// For the program's own loop; the poller keeps it.
  [[nodiscard]] int descriptor() const { return epoll_; }

  /// Watches a socket until it is closed or unwatched. Returns 0, or `errno` of the failure.
  [[nodiscard]] int watch(int socket) const;
  /// Before the socket is closed, while a copy of its descriptor may live on.
  void unwatch(int socket) const;
  /// Whether room to write is an event too.
  void watchOutput(int socket, bool wanted) const;

  /// Ends the wait under way, or the next one.
  void wake() const;
  /// Ends a wait at that time; none: at no time.
  void arm(std::optional<Time> time);

  /// Waits until an event is due or `deadline` has passed; none: without limit.
  [[nodiscard]] Events wait(std::optional<Time> deadline);

  /// Closes the descriptors, in a child process whose parent keeps copies.
  void abandon();

 private:
  // Constant after construction until they are abandoned.
  int epoll_ = -1;  // watches the other two, and the socket
  int wake_ = -1;   // an event counter
  int timer_ = -1;  // of the monotonic clock
  int error_ = 0;

  std::optional<Time> armed_;  // used by the driver alone
};

}  // namespace quarvel
