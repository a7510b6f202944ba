// Measures the cost of one report for its calling thread, through a RealtimeReporter and with a
// plain sendMessage. The same run measures a clock_gettime and an empty call for comparison. A
// child process takes the place of the service; it reads and discards.
//
// After each round of calls a pause lets the ring empty, like the time between two audio callbacks.
// Every sample includes one reading of the clock, which the row "nothing" shows alone.
//
// Usage: realtime-bench [SAMPLES]

#include <fmt/format.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdint>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include <quarvel/realtime.hpp>

namespace quarvel {
namespace {

constexpr int kRound = 64;

std::int64_t Nanoseconds() {
  timespec time{};
  ::clock_gettime(CLOCK_MONOTONIC, &time);
  return std::int64_t{time.tv_sec} * 1'000'000'000 + time.tv_nsec;
}

/// Discards all bytes of one client until the client disconnects. Runs in the child process.
[[noreturn]] void ForgetEverything(int listener) {
  ::prctl(PR_SET_PDEATHSIG, SIGKILL);
  const int connection = ::accept(listener, nullptr, nullptr);
  std::vector<char> bytes(1 << 20);
  while (::recv(connection, bytes.data(), bytes.size(), 0) > 0) continue;
  std::_Exit(0);
}

template <class Call, class Pause>
void Measure(const char* name, std::size_t samples, Call call, Pause pause) {
  std::vector<std::int64_t> taken;
  taken.reserve(samples);
  while (taken.size() < samples) {
    for (int i = 0; i < kRound; ++i) {
      const std::int64_t before = Nanoseconds();
      call();
      taken.push_back(Nanoseconds() - before);
    }
    pause();
  }
  std::ranges::sort(taken);
  const auto at = [&](double share) {
    return taken[static_cast<std::size_t>(share * static_cast<double>(taken.size() - 1))];
  };
  fmt::print("{:<28}{:>8}{:>8}{:>8}{:>10}\n", name, at(0.5), at(0.99), at(0.999), taken.back());
}

void Run(Client& client, std::size_t samples) {
  RealtimeReporter::Options options;
  options.interval = std::chrono::milliseconds(1);
  RealtimeReporter reporter(client, 7, options);
  reporter.start();
  const RealtimeReporter::Category category(vocabulary::Component::hal, vocabulary::Kind::playback);
  const auto type = RealtimeReporter::MessageType::generic;
  const auto nothing = [] {};
  std::uint64_t recorded = 0;

  fmt::print("{:<28}{:>8}{:>8}{:>8}{:>10}  nanoseconds\n", "", "p50", "p99", "p99.9", "longest");
  Measure("nothing", samples, nothing, nothing);
  Measure(
      "clock_gettime", samples, [] { static_cast<void>(Nanoseconds()); }, nothing);
  Measure(
      "RealtimeReporter, 5 values", samples,
      [&] {
        recorded += reporter.record(category, type)
                            .set("frames", 512)
                            .set("load", 0.43)
                            .set("glitches", 0)
                            .set("late", false)
                            .set("route", "Speaker")
                            .send()
                        ? 1U
                        : 0U;
      },
      [&] {
        while (reporter.statistics().sent < recorded) {
          std::this_thread::sleep_for(std::chrono::milliseconds(1));
        }
      });
  const Payload payload(Dictionary{
      {"frames", 512}, {"load", 0.43}, {"glitches", 0}, {"late", false}, {"route", "Speaker"}});
  Measure(
      "sendMessage, made before", samples, [&] { client.sendMessage(payload, category, type, 7); },
      [] { std::this_thread::sleep_for(std::chrono::milliseconds(1)); });
  const auto [sent, lost] = reporter.statistics();
  fmt::print("{} records sent, {} lost\n", sent, lost.total());
}

}  // namespace
}  // namespace quarvel

int main(int argc, char** argv) {
  const std::size_t samples = argc > 1 ? std::strtoull(argv[1], nullptr, 10) : 200'000;
  char directory[] = "/tmp/quarvel-bench-XXXXXX";
  const std::string path = std::string(::mkdtemp(directory)) + "/reporting.sock";
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  const int listener = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  ::bind(listener, reinterpret_cast<sockaddr*>(&address), sizeof address);
  ::listen(listener, 1);
  const pid_t child = ::fork();
  if (child == 0) quarvel::ForgetEverything(listener);
  int status = 0;
  {
    auto client = quarvel::Client::connect(path);
    if (client) {
      quarvel::Run(client.value(), samples);
    } else {
      fmt::print(stderr, "realtime-bench: {}\n", client.error().description());
      ::kill(child, SIGKILL);
      status = 1;
    }
  }
  ::waitpid(child, nullptr, 0);
  std::filesystem::remove_all(directory);
  return status;
}
