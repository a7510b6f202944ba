#include "device/DirectoryWatch.h"

#include <sys/inotify.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <system_error>
#include <utility>

#include "base/Files.h"
#include "platform/Log.h"
#include "queues/Thread.h"

namespace quarvel {

namespace {

// A shell's `touch` closes a file that was open for writing; utime(2) by path changes attributes.
constexpr std::uint32_t kChanges = IN_CLOSE_WRITE | IN_MOVED_TO | IN_ATTRIB | IN_ONLYDIR;

}  // namespace

DirectoryWatch::~DirectoryWatch() {
  end();
}

void DirectoryWatch::end() {
  const MutexLock lock(mutex_);
  if (descriptor_ < 0) return;
  ending_ = true;
  // Removing a watch is an event too, which wakes the thread.
  inotify_rm_watch(descriptor_, inotify_add_watch(descriptor_, "/", IN_DELETE_SELF));
  while (running_) ended_.wait(mutex_);
  ::close(std::exchange(descriptor_, -1));
}

int DirectoryWatch::start() {
  if (descriptor_ >= 0) return 0;
  descriptor_ = inotify_init1(IN_CLOEXEC);
  if (descriptor_ < 0) return errno;
  const int status = StartThread("tarnwick.quarvel.watch", 0,
                                 [this, descriptor = descriptor_] { run(descriptor); });
  running_ = status == 0;
  if (!running_) ::close(std::exchange(descriptor_, -1));
  return status;
}

int DirectoryWatch::add(const std::filesystem::path& directory, Handler handler) {
  if (const int status = CreatePrivateDirectory(directory); status != 0) return status;
  const MutexLock lock(mutex_);
  if (const int status = start(); status != 0) return status;
  const int identifier = inotify_add_watch(descriptor_, directory.c_str(), kChanges);
  if (identifier < 0) return errno;
  watched_.push_back({identifier, directory, std::make_shared<const Handler>(std::move(handler))});
  return 0;
}

void DirectoryWatch::report(int identifier, std::string_view file) {
  std::vector<std::shared_ptr<const Handler>> handlers;
  {
    const MutexLock lock(mutex_);
    for (const Watched& watched : watched_) {
      if (file.empty() || watched.identifier == identifier) handlers.push_back(watched.handler);
    }
  }
  for (const auto& handler : handlers) (*handler)(file);
}

bool DirectoryWatch::dropDirectory(int identifier) {
  ZQ_FUNCTION("DirectoryWatch");
  const MutexLock lock(mutex_);
  if (ending_) return true;
  for (const Watched& watched : watched_) {
    if (watched.identifier != identifier) continue;
    ZQ_LOG(nullptr, error, "{} was removed: changes in it are not noticed until the next start",
           watched.directory.native());
  }
  std::erase_if(watched_, [=](const Watched& watched) { return watched.identifier == identifier; });
  return false;
}

void DirectoryWatch::run(int descriptor) {
  reportUntilEnd(descriptor);
  const MutexLock lock(mutex_);
  running_ = false;
  ended_.notifyAll();
}

void DirectoryWatch::reportUntilEnd(int descriptor) {
  ZQ_FUNCTION("DirectoryWatch");
  alignas(inotify_event) std::array<char, 4096> events{};
  for (;;) {
    const ssize_t length = ::read(descriptor, events.data(), events.size());
    if (length < 0 && errno == EINTR) continue;
    if (length < 0) {
      ZQ_LOG(nullptr, error, "reading changes of directories: {}",
             std::generic_category().message(errno));
      return;
    }
    for (std::size_t at = 0; at < static_cast<std::size_t>(length);) {
      inotify_event event{};
      std::memcpy(&event, events.data() + at, sizeof event);
      const char* name = events.data() + at + sizeof event;
      at += sizeof event + event.len;
      if ((event.mask & IN_IGNORED) != 0) {
        if (dropDirectory(event.wd)) return;
      } else if ((event.mask & IN_Q_OVERFLOW) != 0) {
        report(event.wd, {});
      } else if (event.len > 0) {  // without a name the event concerns the directory itself
        report(event.wd, name);
      }
    }
  }
}

}  // namespace quarvel
