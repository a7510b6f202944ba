// Measures the cost of a message for growing numbers of clients, sessions, messages in a history,
// keys of a payload, and sessions that a broadcast reaches. Prints comma-separated values for
// plot.py.
//
// Usage: scale-bench QUARVELD [--messages N] [--most N]

#include <fmt/format.h>
#include <sys/resource.h>

#include <algorithm>
#include <chrono>
#include <csignal>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "bench/Subject.h"

namespace quarvel {
namespace {

using Clock = std::chrono::steady_clock;
constexpr std::size_t kWindow = 64;

struct Load {
  std::vector<std::unique_ptr<WireClient>> clients;
  std::vector<std::string> frames;  // one per client; with a single client, all its frames in turn
  std::size_t messages;
  std::size_t rowsPerMessage = 1;
};

/// Sends in rounds: a few messages on every connection, then waits for all replies.
void Send(Load& load, std::size_t messages) {
  const std::size_t each = std::clamp<std::size_t>(messages / load.clients.size(), 1, kWindow);
  std::string batch;
  std::size_t next = 0;
  for (std::size_t sent = 0; sent < messages;) {
    std::size_t asked = 0;
    for (; asked < load.clients.size() && sent < messages; ++asked, sent += each) {
      batch.clear();
      for (std::size_t i = 0; i < each; ++i) {
        const std::size_t frame = load.clients.size() == 1 ? next++ : asked;
        batch += load.frames[frame % load.frames.size()];
      }
      load.clients[asked]->write(batch);
    }
    for (std::size_t i = 0; i < asked; ++i) {
      for (std::size_t replies = 0; replies < each;) replies += load.clients[i]->readReplies();
    }
  }
}

/// Prints the whole cost of one message, from the socket to the store.
void Measure(const char* sweep, std::size_t size, const Subject& service,
             const std::function<Load(const Server&)>& prepare) {
  const auto server = service.start();
  Load load = prepare(*server);
  const double processor = server->cpuSeconds();
  const auto begin = Clock::now();
  Send(load, load.messages);
  service.awaitStored(*server, load.messages * load.rowsPerMessage);
  const double seconds = std::chrono::duration<double>(Clock::now() - begin).count();
  const auto count = static_cast<double>(load.messages * load.rowsPerMessage);
  fmt::print("{},{},{:.3f},{:.0f},{:.1f}\n", sweep, size,
             (server->cpuSeconds() - processor) * 1e6 / count, count / seconds,
             server->residentMegabytes());
  std::fflush(stdout);
}

std::vector<std::unique_ptr<WireClient>> Only(std::unique_ptr<WireClient> client) {
  std::vector<std::unique_ptr<WireClient>> clients;
  clients.push_back(std::move(client));
  return clients;
}

void Sweep(const Subject& service, std::size_t messages, std::size_t most) {
  for (std::size_t count = 1; count <= most; count *= 10) {
    Measure("clients", count, service, [&](const Server& server) {
      Load load{{}, {}, std::max(messages, count)};
      for (std::size_t i = 1; i <= count; ++i) {
        load.clients.push_back(service.connect(server, static_cast<std::int64_t>(i)));
        load.frames.push_back(SendMessageFrame(7, static_cast<std::int64_t>(i)));
      }
      return load;
    });
  }
  for (std::size_t count = 1; count <= most; count *= 10) {
    Measure("sessions", count, service, [&](const Server& server) {
      Load load{Only(service.connect(server, 1)), {SendMessageFrame(7, 1)}, messages};
      for (std::size_t i = 2; i <= count; ++i) {
        load.clients.front()->startSession(static_cast<std::int64_t>(i));
        load.frames.push_back(SendMessageFrame(7, static_cast<std::int64_t>(i)));
      }
      return load;
    });
  }
  for (std::size_t count = 1000; count <= 100 * most; count *= 10) {
    Measure("history", count, service, [&](const Server& server) {
      return Load{Only(service.connect(server, 1)), {SendMessageFrame(7, 1)}, count};
    });
  }
  for (const std::size_t keys : std::initializer_list<std::size_t>{1, 2, 5, 10, 20, 50, 100, 200}) {
    Measure("keys", keys, service, [&](const Server& server) {
      return Load{Only(service.connect(server, 1)),
                  {SendMessageFrame(7, 1, PayloadOfKeys(keys))},
                  messages / 4};
    });
  }
  for (std::size_t count = 1; count <= std::min<std::size_t>(most, 1000); count *= 10) {
    Measure("broadcast", count, service, [&](const Server& server) {
      Load load{
          Only(service.connect(server, 1)), {SendMessageFrame(7, 0)}, messages / count, count};
      for (std::size_t i = 2; i <= count; ++i) {
        load.clients.front()->startSession(static_cast<std::int64_t>(i));
      }
      return load;
    });
  }
}

}  // namespace
}  // namespace quarvel

int main(int argc, char** argv) {
  std::signal(SIGPIPE, SIG_IGN);
  rlimit descriptors{};
  getrlimit(RLIMIT_NOFILE, &descriptors);
  descriptors.rlim_cur = descriptors.rlim_max;
  setrlimit(RLIMIT_NOFILE, &descriptors);
  std::map<std::string, std::string> options{{"--messages", "100000"}, {"--most", "10000"}};
  bool usable = argc >= 2 && argc % 2 == 0;
  for (int i = 2; usable && i < argc; i += 2) {
    usable = options.contains(argv[i]);
    options[argv[i]] = argv[i + 1];
  }
  if (!usable) {
    fmt::print(stderr, "usage: scale-bench QUARVELD [--messages N] [--most N]\n");
    return 2;
  }
  fmt::print("sweep,size,processor_us_per_message,messages_per_second,resident_mb\n");
  quarvel::Sweep(*quarvel::ServiceSubject(argv[1], 1), std::stoul(options["--messages"]),
                 std::stoul(options["--most"]));
  return 0;
}
