#pragma once

#include <sys/types.h>
#include <unistd.h>

#include <filesystem>
#include <utility>

#include "base/Error.h"

namespace quarvel {

/// Owns one file descriptor, or none; closes it when destroyed. Not synchronised.
class UniqueDescriptor {
 public:
  UniqueDescriptor() = default;
  /// Takes over an open descriptor; a negative one is none.
  explicit UniqueDescriptor(int descriptor) : descriptor_(descriptor) {}
  UniqueDescriptor(UniqueDescriptor&& other) noexcept : descriptor_(other.release()) {}
  UniqueDescriptor& operator=(UniqueDescriptor&& other) noexcept {
    std::swap(descriptor_, other.descriptor_);
    return *this;
  }
  UniqueDescriptor(const UniqueDescriptor&) = delete;
  UniqueDescriptor& operator=(const UniqueDescriptor&) = delete;
  ~UniqueDescriptor() {
    if (descriptor_ >= 0) ::close(descriptor_);
  }

  /// The descriptor, still owned; negative when there is none.
  [[nodiscard]] int get() const { return descriptor_; }
  /// Gives the descriptor away.
  [[nodiscard]] int release() { return std::exchange(descriptor_, -1); }
  /// Whether there is one.
  explicit operator bool() const { return descriptor_ >= 0; }

 private:
  int descriptor_ = -1;
};

/// The Unix stream socket that clients connect to, non-blocking, with its socket file.
/// Owner: the listener, until the service ends. One thread at a time.
/// Errors are of domain "quarvel.listener", with a reason that names the socket.
class ListeningSocket {
 public:
  /// Takes over a listening socket that the service manager passed in.
  [[nodiscard]] static Result<ListeningSocket> inherited(UniqueDescriptor descriptor);
  /// Listens at `path`, mode 0660. A missing directory is made, mode 0750. The stale socket file of
  /// an ended service is replaced; a socket in use is an error. When several services start at
  /// once, exactly one succeeds. Blocks while another service starts in the same directory.
  [[nodiscard]] static Result<ListeningSocket> listeningAt(const std::filesystem::path& path);

  ListeningSocket(ListeningSocket&&) noexcept = default;
  ListeningSocket& operator=(ListeningSocket&&) = delete;
  /// Calls `removeFile`.
  ~ListeningSocket();

  /// For accept(), until `releaseDescriptor`.
  [[nodiscard]] int descriptor() const { return descriptor_.get(); }
  /// Gives the descriptor away. This object still removes the file.
  [[nodiscard]] UniqueDescriptor releaseDescriptor() { return std::move(descriptor_); }
  /// Removes the socket file, unless another service has replaced it. False when `listeningAt` made
  /// none or it was removed before.
  bool removeFile();

 private:
  ListeningSocket() = default;

  UniqueDescriptor descriptor_;
  std::filesystem::path path_;  // empty: nothing to remove
  dev_t device_ = 0;            // with the inode: identity of the file that was made
  ino_t inode_ = 0;
};

}  // namespace quarvel
