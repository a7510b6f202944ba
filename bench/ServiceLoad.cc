// Puts a load of known size on a running service, for profiles and instruction counts. Prints a
// line when all calls are answered; its sessions stay started until its standard input ends.
//
// Usage: service-load SOCKET MESSAGES [CLIENTS] [IN-FLIGHT]

#include <cstdio>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "bench/WireClient.h"

int main(int argc, char** argv) {
  if (argc < 3) {
    std::fputs("usage: service-load SOCKET MESSAGES [CLIENTS] [IN-FLIGHT]\n", stderr);
    return 2;
  }
  const std::size_t messages = std::stoul(argv[2]);
  const std::size_t clients = argc > 3 ? std::stoul(argv[3]) : 1;
  const std::size_t inFlight = argc > 4 ? std::stoul(argv[4]) : 64;
  std::vector<std::unique_ptr<quarvel::WireClient>> connections;
  for (std::size_t i = 0; i < clients; ++i) {
    connections.push_back(std::make_unique<quarvel::WireClient>(argv[1]));
    connections[i]->startSession(static_cast<std::int64_t>(i + 1));
  }
  std::vector<std::thread> threads;
  for (std::size_t i = 0; i < clients; ++i) {
    threads.emplace_back([&, i] {
      connections[i]->pipeline(quarvel::SendMessageFrame(7, static_cast<std::int64_t>(i + 1)),
                               messages / clients, inFlight);
    });
  }
  for (std::thread& thread : threads) thread.join();
  std::puts("answered");
  std::fflush(stdout);
  while (std::getchar() != EOF) {
  }
  return 0;
}
