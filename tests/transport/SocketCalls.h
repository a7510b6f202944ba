#pragma once

#include <cstddef>
#include <map>
#include <optional>
#include <string>

#include "base/Mutex.h"

namespace quarvel::testing {

/// Stands between this program and the C library for what the threads that say so ask of sockets,
/// event loops and the listening socket's directory: counts the calls of each function, and makes
/// them fail. One for the process.
class SocketCalls {
 public:
  struct Fault {
    std::string function;
    /// Which of its calls fails, counted from 0 since `begin`.
    std::size_t at = 0;
    /// The system's error number; 0: `send` sends half of what it was given.
    int error = 0;
    /// Whether every call after it fails too, until `lift`.
    bool forever = false;
  };

  [[nodiscard]] static SocketCalls& instance();

  /// Counts from nothing, with this fault or none.
  void begin(std::optional<Fault> fault) QUARVEL_EXCLUDES(mutex_);
  void lift() QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] std::map<std::string, std::size_t> counts() QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] std::size_t failed() QUARVEL_EXCLUDES(mutex_);

  /// The calls of the thread that it lives on are looked at.
  class Watched {
   public:
    Watched();
    ~Watched();
    Watched(const Watched&) = delete;
    Watched& operator=(const Watched&) = delete;
  };

  /// From the C library's functions: none when the call is to be made, else the error.
  [[nodiscard]] std::optional<int> admit(const char* function) QUARVEL_EXCLUDES(mutex_);

 private:
  Mutex mutex_;
  std::optional<Fault> fault_ QUARVEL_GUARDED_BY(mutex_);
  std::map<std::string, std::size_t> counts_ QUARVEL_GUARDED_BY(mutex_);
  std::size_t failed_ QUARVEL_GUARDED_BY(mutex_) = 0;
};

}  // namespace quarvel::testing
