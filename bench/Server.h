#pragma once

#include <sys/types.h>

#include <cstdint>
#include <filesystem>
#include <functional>

namespace quarvel {

/// A server under test: a child process and its directory. The destructor ends the process and
/// removes the directory. Used by the thread that made it.
class Server {
 public:
  /// Calls `run` with the directory in the new process; `run` must not return.
  explicit Server(const std::function<void(const std::filesystem::path& directory)>& run);
  ~Server();
  /// Ends the process in order and starts it again in the same directory.
  void restart(const std::function<void(const std::filesystem::path& directory)>& run);
  Server(const Server&) = delete;
  Server& operator=(const Server&) = delete;

  [[nodiscard]] const std::filesystem::path& directory() const { return directory_; }

  /// User and system time since the process started, in seconds.
  [[nodiscard]] double cpuSeconds() const;
  /// Megabytes (2^20): of `Rss`, `Pss` (smaps_rollup) and `VmHWM`, the peak.
  [[nodiscard]] double residentMegabytes() const;
  [[nodiscard]] double proportionalMegabytes() const;
  [[nodiscard]] double peakMegabytes() const;
  /// Bytes written to a medium on behalf of the process.
  [[nodiscard]] std::uint64_t bytesWritten() const;
  /// How often any of the threads has woken up from a wait.
  [[nodiscard]] std::uint64_t wakeUps() const;

 private:
  void begin(const std::function<void(const std::filesystem::path& directory)>& run);
  void end() const;

  std::filesystem::path directory_;
  pid_t process_ = -1;
};

}  // namespace quarvel
