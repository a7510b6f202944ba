#pragma once

#include <chrono>
#include <optional>

#include "base/Error.h"

namespace quarvel {

/// All that a connection waits for behind one descriptor, which is readable while something is due:
/// its socket, a wake-up from another thread, a point in time. `wait` and `arm` belong to whoever
/// drives the connection; the other functions may be called from every thread.
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

  /// Whether the process was allowed the descriptors; else `errno` of the failure.
  [[nodiscard]] int error() const { return error_; }
  [[nodiscard]] int descriptor() const { return epoll_; }

  /// The socket is watched until it is closed or another is. Returns 0, or `errno` of the failure.
  [[nodiscard]] int watch(int socket) const;
  void unwatch(int socket) const;
  /// Whether room to write counts as something due.
  void watchOutput(int socket, bool wanted) const;

  /// Ends the wait under way, or the next one.
  void wake() const;
  /// Ends a wait at that time; none: at no time.
  void arm(std::optional<Time> time);

  /// Waits until something is due or `deadline` has passed; none: as long as it takes.
  [[nodiscard]] Events wait(std::optional<Time> deadline);

  /// Closes the descriptors, of which another process has copies.
  void abandon();

 private:
  // Constant after construction until they are abandoned.
  int epoll_ = -1;
  int wake_ = -1;
  int timer_ = -1;
  int error_ = 0;

  std::optional<Time> armed_;  // the driver's own
};

}  // namespace quarvel
