#include "store/database/StoreFile.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <functional>
#include <system_error>

#include "platform/Log.h"
#include "store/database/StoreError.h"

namespace quarvel {

namespace {

constexpr mode_t kMode = 0640;
constexpr mode_t kDirectoryMode = 0750;

StoreErrorCode CodeOf(int errorNumber) {
  switch (errorNumber) {
    case ENOSPC:
    case EDQUOT:
      return StoreErrorCode::diskFull;
    case EIO:
    case EINTR:
    case EAGAIN:
    case EMFILE:
    case ENFILE:
    case ENOMEM:
      return StoreErrorCode::failed;
    default:
      return StoreErrorCode::inaccessible;
  }
}

bool Exists(const std::string& path) {
  struct stat status {};
  return ::lstat(path.c_str(), &status) == 0;
}

/// Makes names safe. Where that fails, they are as safe as the file system makes them by itself.
void SyncNames(const std::filesystem::path& file) {
  const std::filesystem::path directory = file.parent_path();
  const int descriptor =
      ::open(directory.empty() ? "." : directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (descriptor < 0) return;
  ::fsync(descriptor);
  ::close(descriptor);
}

std::string AsideName(const std::filesystem::path& path, Date now) {
  std::string time = DateText(now);
  std::erase_if(time, [](char character) { return character == '-' || character == ':'; });
  return fmt::format("{}.corrupt-{}", path.string(), time);
}

/// The log of a store whose file was set aside, or taken away: SQLite would remove it, or worse,
/// take it for the new file's.
Outcome MoveLogAside(const std::filesystem::path& path, Date now) {
  const std::string log = path.string() + "-wal";
  if (!Exists(log)) return Success();
  const auto aside = StoresSetAside(path);
  std::string to = (aside.empty() ? AsideName(path, now) : aside.front().string()) + "-wal";
  if (Exists(to)) to = AsideName(path, now) + "-wal";
  if (::rename(log.c_str(), to.c_str()) == 0) return Success();
  return StoreUnusable(log, errno, "It belongs to no store: move it away.");
}

}  // namespace

Error StoreUnusable(const std::filesystem::path& path, int errorNumber, std::string_view remedy) {
  return StoreError(CodeOf(errorNumber),
                    fmt::format("The telemetry store {} cannot be used: {}. {}", path.string(),
                                std::generic_category().message(errorNumber), remedy));
}

Outcome MakeStoreFile(const std::filesystem::path& path, Date now) {
  if (!Exists(path.string())) {
    if (Outcome moved = MoveLogAside(path, now); !moved) return moved;
  }
  const int made = ::open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, kMode);
  if (made >= 0) {
    // The process's mask may have taken bits away.
    const int failure = ::fchmod(made, kMode) == 0 ? 0 : errno;
    ::close(made);
    if (failure == 0) return Success();
    ::unlink(path.c_str());
    return StoreUnusable(path, failure, "The file system must keep permissions.");
  }
  const std::string directory = path.parent_path().string();
  if (errno == ENOENT || errno == ENOTDIR) {
    return StoreUnusable(path, errno,
                         fmt::format("Make the directory {}, or set path in [store].", directory));
  }
  if (errno != EEXIST) {
    return StoreUnusable(
        path, errno,
        fmt::format("Let the service write to {}, or set path in [store].", directory));
  }
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0) {
    return StoreUnusable(path, errno, "Let the service read and write it.");
  }
  if (!S_ISREG(status.st_mode)) {
    return StoreUnusable(path, EEXIST, "It must be a file: move away what is there.");
  }
  if (::access(path.c_str(), R_OK | W_OK) != 0) {
    return StoreUnusable(path, errno, "Let the service read and write it, or set path in [store].");
  }
  if (::access(path.parent_path().empty() ? "." : directory.c_str(), W_OK | X_OK) != 0) {
    // The write-ahead log stands beside the file.
    return StoreUnusable(path, errno, fmt::format("Let the service write to {} too.", directory));
  }
  return Success();
}

Result<std::filesystem::path> MakePlaceFor(const std::filesystem::path& path, Date now) {
  if (Exists(path.string())) return std::filesystem::path(AsideName(path, now));
  const std::filesystem::path directory = path.parent_path();
  if (!directory.empty() && !Exists(directory.string()) &&
      ::mkdir(directory.c_str(), kDirectoryMode) != 0) {
    return StoreUnusable(path, errno, fmt::format("Make the directory {}.", directory.string()));
  }
  if (Outcome made = MakeStoreFile(path, now); !made) return made.error();
  return path;
}

Outcome SyncStoreFile(const std::filesystem::path& path) {
  const int descriptor = ::open(path.c_str(), O_RDWR | O_CLOEXEC);
  if (descriptor < 0) return StoreUnusable(path, errno, "");
  const int failure = ::fsync(descriptor) == 0 ? 0 : errno;
  ::close(descriptor);
  if (failure != 0) return StoreUnusable(path, failure, "");
  SyncNames(path);
  return Success();
}

Outcome SetStoreAside(const std::filesystem::path& path, Date now, const std::string& reason) {
  ZQ_FUNCTION("SetStoreAside");
  const std::string aside = AsideName(path, now);
  for (const char* suffix : {"", "-wal", "-shm"}) {
    const std::string from = path.string() + suffix;
    if (::rename(from.c_str(), (aside + suffix).c_str()) != 0 && errno != ENOENT) {
      return StoreUnusable(from, errno, "It is corrupt: move it away.");
    }
  }
  SyncNames(path);
  ZQ_LOG(nullptr, error,
         "The telemetry store {} is corrupt ({}). It is kept as {}, and a new one begun.",
         path.string(), reason, aside);
  return Success();
}

std::vector<std::filesystem::path> StoresSetAside(const std::filesystem::path& path) {
  std::vector<std::filesystem::path> aside;
  const std::string prefix = path.filename().string() + ".corrupt-";
  const std::filesystem::path directory = path.has_parent_path() ? path.parent_path() : ".";
  std::error_code failure;
  for (auto entry = std::filesystem::directory_iterator(directory, failure);
       !failure && entry != std::filesystem::directory_iterator(); entry.increment(failure)) {
    const std::string name = entry->path().filename().string();
    const bool isSideFile = name.ends_with("-wal") || name.ends_with("-shm");
    if (name.starts_with(prefix) && !isSideFile) aside.push_back(entry->path());
  }
  std::ranges::sort(aside, std::greater());
  return aside;
}

}  // namespace quarvel
