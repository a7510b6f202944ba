#include "platform/Process.h"

#include <errno.h>
#include <fcntl.h>
#include <fmt/format.h>
#include <unistd.h>

#include <string_view>

#include "base/Utf8.h"
#include "linux/Service.h"

namespace quarvel {
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

void ExitProcess(int status) {
  if (Service* const service = Service::running()) service->processExit().exit(status);
  _exit(status);
}

}  // namespace quarvel
