#pragma once

#include <sys/types.h>

#include <cstdint>
#include <filesystem>
#include <functional>

namespace quarvel {

/// A server under test: a process in a directory of its own, both gone with the object.
class Server {
 public:
  /// Calls `run` with the directory in the new process, which must not return.
  explicit Server(const std::function<void(const std::filesystem::path& directory)>& run);
  ~Server();
  /// Ends the process in order and starts it again where it was.
  void restart(const std::function<void(const std::filesystem::path& directory)>& run);
  Server(const Server&) = delete;
  Server& operator=(const Server&) = delete;

  [[nodiscard]] const std::filesystem::path& directory() const { return directory_; }

  /// User and system time so far.
  [[nodiscard]] double cpuSeconds() const;
  /// Megabytes (2^20): of `Rss`, `Pss` (smaps_rollup) and `VmHWM`, the peak.
  [[nodiscard]] double residentMegabytes() const;
  [[nodiscard]] double proportionalMegabytes() const;
  [[nodiscard]] double peakMegabytes() const;
  /// Bytes that the process has caused to be written to a medium.
  [[nodiscard]] std::uint64_t bytesWritten() const;
  /// Times that any of its threads woke up from a wait, so far.
  [[nodiscard]] std::uint64_t wakeUps() const;

 private:
  void begin(const std::function<void(const std::filesystem::path& directory)>& run);
  void end() const;

  std::filesystem::path directory_;
  pid_t process_ = -1;
};

}  // namespace quarvel
