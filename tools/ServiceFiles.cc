#include "tools/ServiceFiles.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <poll.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <iterator>
#include <system_error>
#include <vector>

#include <quarvel/client.hpp>

#include "base/Files.h"
#include "base/StandardPaths.h"

namespace quarvel::commands {
namespace {

using std::filesystem::path;

std::string WhyNotPosted(const path& directory, int error) {
  if (error == ENOENT || error == ENOTDIR) {
    return fmt::format(
        "The service is not running: there is no directory {}. If its runtime directory is "
        "elsewhere, name it in RUNTIME_DIRECTORY.",
        directory.native());
  }
  return fmt::format("{} cannot be written: {}.{}", directory.native(),
                     std::generic_category().message(error),
                     error == EACCES ? " Try it as root or as the service's user." : "");
}

}  // namespace

path RuntimeDirectory(const Options& options) {
  const path socket = options.socket.empty() ? Client::defaultSocketPath() : options.socket;
  std::vector<path> candidates{socket.parent_path()};
  std::ranges::copy(StandardPaths::candidates(StandardPaths::Kind::runtime, ::geteuid() == 0),
                    std::back_inserter(candidates));
  // The installed service's directory counts only when the socket is in it: commands for another
  // service must not reach the installed one.
  candidates.pop_back();
  for (const path& candidate : candidates) {
    if (::access((candidate / "notify").c_str(), F_OK) == 0) return candidate;
  }
  return candidates.front();
}

bool ServiceIsUp(const Options& options) {
  return Client::connect(options.socket).ok();
}

Result<path> Post(const Options& options, const std::string& name) {
  const path directory = RuntimeDirectory(options) / "notify";
  path file = directory / name;
  const int posted =
      ::open(file.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK, 0640);
  if (posted < 0 || ::futimens(posted, nullptr) != 0) {
    const int error = errno;
    if (posted >= 0) ::close(posted);
    return Error::because("quarvel.notification", 1, WhyNotPosted(directory, error));
  }
  ::close(posted);
  return file;
}

Error StatusError(std::string reason) {
  return Error::because("quarvel.status", 1, std::move(reason));
}

Result<std::string> StatusText(const Options& options) {
  constexpr const char* kNotification = "tarnwick.quarvel.status";
  constexpr const char* kFile = "status.json";
  constexpr std::chrono::seconds kTimeout{5};
  const path directory = RuntimeDirectory(options);
  const FileArrival arrival(directory);
  // When the directory cannot be watched, posting fails with the reason.
  const auto posted = Post(options, kNotification);
  if (!posted) return posted.error();
  if (!arrival.watching() || !arrival.wait(kFile, kTimeout)) {
    return StatusError(fmt::format(
        "The service does not answer: it has written no {} within {} seconds. Is it running?",
        (directory / kFile).native(), kTimeout.count()));
  }
  auto text = ReadWholeFile(directory / kFile);
  if (text) return text;
  return StatusError(
      fmt::format("{} cannot be read: {}.", (directory / kFile).native(),
                  std::generic_category().message(static_cast<int>(text.error().code))));
}

FileArrival::FileArrival(const path& directory)
    : descriptor_(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK)),
      watching_(::inotify_add_watch(descriptor_, directory.c_str(), IN_MOVED_TO) >= 0) {}

FileArrival::~FileArrival() {
  ::close(descriptor_);
}

bool FileArrival::wait(const char* name, std::chrono::milliseconds timeout) const {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    const auto left =
        std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) return false;
    pollfd events{descriptor_, POLLIN, 0};
    if (::poll(&events, 1, static_cast<int>(left.count())) > 0 && hasArrived(name)) return true;
  }
}

bool FileArrival::hasArrived(const char* name) const {
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

}  // namespace quarvel::commands
