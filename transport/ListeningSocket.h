#pragma once

#include <sys/types.h>

#include <filesystem>

#include "base/Error.h"
#include "transport/UniqueDescriptor.h"

namespace quarvel {

/// The socket at which clients arrive: non-blocking, a Unix stream socket.
/// Errors are of domain "quarvel.listener", with a reason that names the socket.
class ListeningSocket {
 public:
  /// Takes over one that whoever started the service listens on already.
  [[nodiscard]] static Result<ListeningSocket> inherited(UniqueDescriptor descriptor);
  /// Listens at `path`, mode 0660. A missing directory is made, mode 0750. A socket file that
  /// nobody listens at any more is replaced; it is an error when somebody does. Of several services
  /// that start at once exactly one succeeds.
  [[nodiscard]] static Result<ListeningSocket> listeningAt(const std::filesystem::path& path);

  ListeningSocket(ListeningSocket&&) noexcept = default;
  ListeningSocket& operator=(ListeningSocket&&) = delete;
  /// Does what `removeFile` does.
  ~ListeningSocket();

  [[nodiscard]] int descriptor() const { return descriptor_.get(); }
  /// Gives the descriptor away; the file stays this object's to remove.
  [[nodiscard]] UniqueDescriptor releaseDescriptor() { return std::move(descriptor_); }
  /// Removes the socket file if it is still the one that `listeningAt` made. False when it made
  /// none.
  bool removeFile();

 private:
  ListeningSocket() = default;

  UniqueDescriptor descriptor_;
  std::filesystem::path path_;  // empty: nothing to remove
  dev_t device_ = 0;            // with the inode, which file was made
  ino_t inode_ = 0;
};

}  // namespace quarvel
