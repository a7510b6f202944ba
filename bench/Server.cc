#include "bench/Server.h"

#include <fmt/format.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <fstream>
#include <iterator>
#include <sstream>
#include <string>

#include "bench/WireClient.h"

namespace quarvel {

namespace {

/// The number after `key` in a file of "key: number" lines; 0 when the key is missing.
double Field(const std::string& path, std::string_view key) {
  std::ifstream file(path);
  for (std::string line; std::getline(file, line);) {
    if (line.starts_with(key)) return std::strtod(line.c_str() + key.size(), nullptr);
  }
  return 0;
}

}  // namespace

Server::Server(const std::function<void(const std::filesystem::path& directory)>& run) {
  // On the working directory's disk, since a real store is not in memory either.
  std::string pattern = (std::filesystem::current_path() / "quarvel-bench-XXXXXX").string();
  if (mkdtemp(pattern.data()) == nullptr) Fail("mkdtemp " + pattern);
  directory_ = pattern;
  begin(run);
}

Server::~Server() {
  end();
  std::filesystem::remove_all(directory_);
}

void Server::restart(const std::function<void(const std::filesystem::path& directory)>& run) {
  end();
  begin(run);
}

void Server::begin(const std::function<void(const std::filesystem::path& directory)>& run) {
  process_ = fork();
  if (process_ == 0) {
    run(directory_);
    std::_Exit(1);
  }
}

void Server::end() const {
  kill(process_, SIGTERM);
  waitpid(process_, nullptr, 0);
}

double Server::cpuSeconds() const {
  std::ifstream file(fmt::format("/proc/{}/stat", process_));
  std::string text((std::istreambuf_iterator<char>(file)), {});
  std::istringstream fields(text.substr(text.rfind(')') + 2));
  std::string skipped;
  for (int i = 0; i < 11; ++i) fields >> skipped;
  double user = 0;
  double system = 0;
  fields >> user >> system;
  return (user + system) / static_cast<double>(sysconf(_SC_CLK_TCK));
}

double Server::residentMegabytes() const {
  return Field(fmt::format("/proc/{}/smaps_rollup", process_), "Rss:") / 1024;
}

double Server::proportionalMegabytes() const {
  return Field(fmt::format("/proc/{}/smaps_rollup", process_), "Pss:") / 1024;
}

double Server::peakMegabytes() const {
  return Field(fmt::format("/proc/{}/status", process_), "VmHWM:") / 1024;
}

std::uint64_t Server::bytesWritten() const {
  return static_cast<std::uint64_t>(Field(fmt::format("/proc/{}/io", process_), "write_bytes:"));
}

std::uint64_t Server::wakeUps() const {
  double sum = 0;
  for (const auto& thread :
       std::filesystem::directory_iterator(fmt::format("/proc/{}/task", process_))) {
    sum += Field(thread.path() / "status", "voluntary_ctxt_switches:");
  }
  return static_cast<std::uint64_t>(sum);
}

}  // namespace quarvel
