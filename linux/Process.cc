#include "platform/Process.h"

#include <errno.h>
#include <fcntl.h>
#include <fmt/format.h>
#include <unistd.h>

#include <atomic>
#include <string_view>
#include <utility>
#include <vector>

#include "base/Mutex.h"
#include "base/Utf8.h"
#include "system/LogWriter.h"
#include "system/ProcessExit.h"

namespace quarvel {
namespace {

struct ExitWork {
  Mutex mutex;
  std::vector<Block> blocks QUARVEL_GUARDED_BY(mutex);
};

// Never destroyed: the process may end on any thread, at any time.
ExitWork& exitWork() {
  static ExitWork& instance = *new ExitWork;
  return instance;
}

Block lastExitWork() {
  const MutexLock lock(exitWork().mutex);
  if (exitWork().blocks.empty()) return {};
  Block last = std::move(exitWork().blocks.back());
  exitWork().blocks.pop_back();
  return last;
}

// The thread that ends the process; 0 while nobody does.
std::atomic<pid_t> ending{0};

}  // namespace

std::int32_t OwnProcessIdentifier() {
  return getpid();
}

std::string OwnProcessName() {
  return program_invocation_short_name;
}

std::optional<std::string> ProcessCommandName(std::int32_t processIdentifier) {
  const std::string path = fmt::format("/proc/{}/comm", processIdentifier);
  const int file = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (file < 0) return std::nullopt;
  char text[64];
  const ssize_t length = ::read(file, text, sizeof text);
  ::close(file);
  if (length <= 0) return std::nullopt;
  std::string_view name(text, static_cast<std::size_t>(length));
  if (name.back() == '\n') name.remove_suffix(1);
  // A process may give itself any bytes for a name.
  if (!IsUtf8(name)) return std::nullopt;
  return std::string(name);
}

void AtProcessExit(Block work) {
  const MutexLock lock(exitWork().mutex);
  exitWork().blocks.push_back(std::move(work));
}

void ExitProcess(int status) {
  pid_t nobody = 0;
  if (ending.compare_exchange_strong(nobody, gettid())) {
    while (Block work = lastExitWork()) work();
  } else if (nobody != gettid()) {
    for (;;) pause();  // until the other thread has ended the process
  }
  LogWriter::instance().flush();
  _exit(status);
}

}  // namespace quarvel
