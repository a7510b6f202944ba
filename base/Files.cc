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

/// Creates a new file beside `path`; opens no existing file and follows no link. Returns -1 with
/// errno set when the file cannot be created.
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

/// `owner` has the new file's owner; null: this process's user.
Outcome replace(std::string_view path, std::string_view content, std::optional<mode_t> permissions,
                const struct stat* owner) {
  constexpr mode_t kReadable = 0644;
  std::string name;
  const int descriptor = createBeside(path, name, permissions.value_or(kReadable));
  if (descriptor < 0) return fileError(path, errno);
  int status = 0;
  if (owner != nullptr && fchown(descriptor, owner->st_uid, owner->st_gid) != 0) status = errno;
  if (status == 0 && permissions && fchmod(descriptor, *permissions) != 0) status = errno;
  if (status == 0) status = writeWhole(descriptor, content);
  if (::close(descriptor) != 0 && status == 0) status = errno;
  if (status == 0 && rename(name.c_str(), std::string(path).c_str()) != 0) status = errno;
  if (status == 0) return Success();
  unlink(name.c_str());
  return fileError(path, status);
}

}  // namespace

Outcome MakeDirectory(std::string_view path, mode_t permissions) {
  fs::path directory(path);
  if (!directory.has_filename()) directory = directory.parent_path();
  std::error_code failure;
  if (directory.has_parent_path()) fs::create_directories(directory.parent_path(), failure);
  if (failure) return fileError(directory.parent_path(), failure.value());
  if (mkdir(directory.c_str(), permissions) == 0) {
    // The process's mask has reduced them.
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

Result<std::string> ReadWholeFile(const fs::path& path, std::size_t maximumBytes) {
  const int descriptor = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
  if (descriptor < 0) return fileError(path, errno);
  std::string content;
  char part[16'384];
  ssize_t count = 0;
  int status = 0;
  do {
    count = ::read(descriptor, part, sizeof part);
    if (count < 0 && errno != EINTR) status = errno;
    if (count > 0) content.append(part, static_cast<std::size_t>(count));
    if (content.size() > maximumBytes) status = EFBIG;
  } while (count != 0 && status == 0);
  ::close(descriptor);
  if (status != 0) return fileError(path, status);
  return content;
}

Outcome ReplaceFile(std::string_view path, std::string_view content,
                    std::optional<mode_t> permissions) {
  return replace(path, content, permissions, nullptr);
}

Outcome RewriteFile(const fs::path& path, std::string_view content, mode_t permissions) {
  std::error_code ignored;
  fs::path file = fs::canonical(path, ignored);
  if (ignored) file = path;
  struct stat old {};
  if (::stat(file.c_str(), &old) != 0) {
    return replace(file.native(), content, permissions, nullptr);
  }
  // Only root may give a file away; another user's rewrite makes the file that user's.
  return replace(file.native(), content, old.st_mode & 0777, ::geteuid() == 0 ? &old : nullptr);
}

}  // namespace quarvel
