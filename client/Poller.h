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

  struct Events {
    bool input = false;  // or the end
    bool timer = false;
  };

  Poller();
  ~Poller();
  Poller(const Poller&) = delete;
  Poller& operator=(const Poller&) = delete;

  /// 0, or `errno` of the failure to create the descriptors.
  [[nodiscard]] int error() const { return error_; }
  [[nodiscard]] int descriptor() const { return epoll_; }

  /// Watches a socket until it is closed or unwatched. Returns 0, or `errno` of the failure.
  [[nodiscard]] int watch(int socket) const;
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
  int epoll_ = -1;
  int wake_ = -1;
  int timer_ = -1;
  int error_ = 0;

  std::optional<Time> armed_;  // used by the driver alone
};

}  // namespace quarvel
