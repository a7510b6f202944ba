#include "base/Files.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <filesystem>
#include <string>
#include <system_error>

namespace quarvel {

namespace {

namespace fs = std::filesystem;

Error fileError(const fs::path& path, int status) {
  return Error::because(
      kFileErrorDomain, status,
      fmt::format("{}: {}", path.native(), std::generic_category().message(status)));
}

/// A file of its own beside `path`: nobody else's is opened, nor what a link points to.
/// Returns -1 with errno set when there can be none.
int createBeside(std::string_view path, std::string& name, mode_t permissions) {
  static std::atomic<unsigned> number{0};
  int descriptor = -1;
  do {
    name = fmt::format("{}.{}-{}.new", path, getpid(), number++);
    descriptor = ::open(name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, permissions);
  } while (descriptor < 0 && errno == EEXIST);
  return descriptor;
}

/// Returns 0 or the system's error number.
int writeWhole(int descriptor, std::string_view content) {
  while (!content.empty()) {
    const ssize_t count = ::write(descriptor, content.data(), content.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return errno;
    content.remove_prefix(static_cast<std::size_t>(count));
  }
  // Before the renaming, or a power cut could leave the new name with nothing in it.
  return fdatasync(descriptor) == 0 ? 0 : errno;
}

}  // namespace

Outcome MakeDirectory(std::string_view path, mode_t permissions) {
  fs::path directory(path);
  if (!directory.has_filename()) directory = directory.parent_path();
  std::error_code failure;
  if (directory.has_parent_path()) fs::create_directories(directory.parent_path(), failure);
  if (failure) return fileError(directory.parent_path(), failure.value());
  if (mkdir(directory.c_str(), permissions) == 0) {
    // The process's mask has taken its part of them.
    if (chmod(directory.c_str(), permissions) == 0) return Success();
    return fileError(directory, errno);
  }
  if (errno != EEXIST) return fileError(directory, errno);
  return fs::is_directory(directory, failure) ? Success() : Outcome(fileError(directory, ENOTDIR));
}

int SyncDirectory(const fs::path& directory) {
  const int descriptor =
      ::open(directory.empty() ? "." : directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (descriptor < 0) return errno;
  const int status = fsync(descriptor) == 0 ? 0 : errno;
  ::close(descriptor);
  return status;
}

int CreatePrivateDirectory(const fs::path& directory) {
  if (directory.empty() || ::access(directory.c_str(), F_OK) == 0) return 0;
  const fs::path parent = directory.parent_path();
  if (directory.has_filename()) {
    if (const int status = CreatePrivateDirectory(parent); status != 0) return status;
    if (mkdir(directory.c_str(), kPrivateDirectory) == 0) return SyncDirectory(parent);
    return errno == EEXIST ? 0 : errno;
  }
  return CreatePrivateDirectory(parent);
}

Outcome ReplaceFile(std::string_view path, std::string_view content,
                    std::optional<mode_t> permissions) {
  constexpr mode_t kReadable = 0644;
  std::string name;
  const int descriptor = createBeside(path, name, permissions.value_or(kReadable));
  if (descriptor < 0) return fileError(path, errno);
  int status = permissions && fchmod(descriptor, *permissions) != 0 ? errno : 0;
  if (status == 0) status = writeWhole(descriptor, content);
  if (::close(descriptor) != 0 && status == 0) status = errno;
  if (status == 0 && rename(name.c_str(), std::string(path).c_str()) != 0) status = errno;
  if (status == 0) return Success();
  unlink(name.c_str());
  return fileError(path, status);
}

}  // namespace quarvel
