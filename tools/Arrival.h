#pragma once

#include <poll.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstring>
#include <filesystem>

namespace quarvel {

/// Tells when a file has been put into a directory.
class Arrival {
 public:
  explicit Arrival(const std::filesystem::path& directory)
      : descriptor_(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK)),
        watching_(::inotify_add_watch(descriptor_, directory.c_str(), IN_MOVED_TO) >= 0) {}
  ~Arrival() { ::close(descriptor_); }
  Arrival(const Arrival&) = delete;
  Arrival& operator=(const Arrival&) = delete;

  [[nodiscard]] bool watching() const { return watching_; }

  /// Returns whether `name` came in time.
  [[nodiscard]] bool await(const char* name, std::chrono::milliseconds patience) const {
    const auto deadline = std::chrono::steady_clock::now() + patience;
    for (;;) {
      const auto left =
          std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
      if (left.count() <= 0) return false;
      pollfd news{descriptor_, POLLIN, 0};
      if (::poll(&news, 1, static_cast<int>(left.count())) > 0 && hasCome(name)) return true;
    }
  }

 private:
  [[nodiscard]] bool hasCome(const char* name) const {
    alignas(inotify_event) std::array<char, 4096> events{};
    const ssize_t length = ::read(descriptor_, events.data(), events.size());
    for (ssize_t at = 0; at < length;) {
      inotify_event event{};
      std::memcpy(&event, events.data() + at, sizeof event);
      if (event.len > 0 && std::strcmp(events.data() + at + sizeof event, name) == 0) return true;
      at += static_cast<ssize_t>(sizeof event) + event.len;
    }
    return false;
  }

  const int descriptor_;
  const bool watching_;
};

}  // namespace quarvel
