// Measures the service against its floor in one run: the same messages through a bare socket into
// the same table with nothing in between. Rates are printed with their ratio, since only that
// compares between machines.
//
// Usage: service-bench QUARVELD [MESSAGES] [ROUNDS]

#include <fcntl.h>
#include <fmt/format.h>
#include <sqlite3.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <map>
#include <memory>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "base/Json.h"
#include "base/MessagePack.h"
#include "base/Payload.h"
#include "bench/Floor.h"

namespace quarvel {
namespace {

using Clock = std::chrono::steady_clock;

[[noreturn]] void Fail(const std::string& what) {
  fmt::print(stderr, "service-bench: {}: {}\n", what, std::strerror(errno));
  std::_Exit(1);
}

/// What an audio client reports every few seconds: some 280 bytes on the wire.
Dictionary TypicalPayload() {
  return {{"zqreporting_timestamp", Date(std::chrono::microseconds(1'769'865'901'123'456))},
          {"HostApplicationDisplayID", "org.example.player"},
          {"sample_rate", 48000.0},
          {"io_buffer_frames", 512},
          {"route", "BuiltInSpeaker"},
          {"output_latency_ms", 11.6},
          {"glitch_count", 0},
          {"volume", 0.43},
          {"spatial", true},
          {"codec", "aac-eld"},
          {"processuptime_ms", 1234567}};
}

std::string Call(std::uint32_t messageID, std::string_view method,
                 const std::function<void(MessagePackWriter&)>& arguments, std::size_t count) {
  std::string frame;
  MessagePackWriter writer(frame);
  writer.list(4);
  writer.integer(0);
  // Always five bytes, so that every frame of a kind has one length.
  frame += '\xce';
  for (int shift = 24; shift >= 0; shift -= 8)
    frame += static_cast<char>(messageID >> shift & 0xff);
  writer.string(method);
  writer.list(count);
  arguments(writer);
  return frame;
}

std::string SendMessageFrame(std::uint32_t messageID, std::int64_t reporterID) {
  return Call(
      messageID, "sendMessage:withCategory:andType:forReportingIDs:reply:",
      [reporterID](MessagePackWriter& writer) {
        writer.value(TypicalPayload());
        writer.integer(0x10000003);
        writer.integer(1);
        writer.list(1);
        writer.integer(reporterID);
      },
      4);
}

class Client {
 public:
  explicit Client(const std::string& path)
      : socket_(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    const auto deadline = Clock::now() + std::chrono::seconds(10);
    while (connect(socket_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
      if (Clock::now() > deadline) Fail("connect " + path);
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
  }
  ~Client() { close(socket_); }
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  void write(std::string_view bytes) {
    while (!bytes.empty()) {
      const ssize_t count = ::write(socket_, bytes.data(), bytes.size());
      if (count <= 0) Fail("write");
      bytes.remove_prefix(static_cast<std::size_t>(count));
    }
  }
  /// Waits for at least one reply; returns how many are there.
  std::size_t readReplies() {
    for (;;) {
      char buffer[65536];
      const ssize_t count = read(socket_, buffer, sizeof buffer);
      if (count <= 0) Fail("read");
      pending_.append(buffer, static_cast<std::size_t>(count));
      std::size_t replies = 0;
      std::size_t at = 0;
      MessagePackScanner scanner(1 << 20, 32);
      while (scanner.scan(std::string_view(pending_).substr(at)) ==
             MessagePackScanner::Progress::complete) {
        at += scanner.length();
        scanner.reset();
        ++replies;
      }
      pending_.erase(0, at);
      if (replies > 0) return replies;
    }
  }
  void call(std::string_view method, std::int64_t reporterID, bool answered = true) {
    write(Call(
        0, method, [&](MessagePackWriter& writer) { writer.integer(reporterID); }, 1));
    if (answered) readReplies();
  }
  /// Sends `count` messages with at most `window` unanswered.
  void pipeline(std::int64_t reporterID, std::size_t count, std::size_t window) {
    const std::string frame = SendMessageFrame(7, reporterID);
    std::string batch;
    std::size_t sent = 0;
    for (std::size_t answered = 0; answered < count; answered += readReplies()) {
      const std::size_t more = std::min(count - sent, window - (sent - answered));
      batch.clear();
      for (std::size_t i = 0; i < more; ++i) batch += frame;
      write(batch);
      sent += more;
    }
  }

 private:
  int socket_;
  std::string pending_;
};

/// A server under test in a directory of its own.
class Server {
 public:
  explicit Server(const std::function<void(const std::filesystem::path& directory)>& run) {
    std::string pattern =
        (std::filesystem::temp_directory_path() / "quarvel-bench-XXXXXX").string();
    if (mkdtemp(pattern.data()) == nullptr) Fail("mkdtemp");
    directory_ = pattern;
    process_ = fork();
    if (process_ == 0) {
      run(directory_);
      std::_Exit(1);
    }
  }
  ~Server() {
    kill(process_, SIGTERM);
    waitpid(process_, nullptr, 0);
    std::filesystem::remove_all(directory_);
  }
  Server(const Server&) = delete;
  Server& operator=(const Server&) = delete;

  [[nodiscard]] std::string socket() const { return directory_ / "reporting.sock"; }
  /// Returns when the store holds `rows` messages.
  void waitForRows(std::int64_t rows) {
    sqlite3* database = nullptr;
    const std::string path = directory_ / "telemetry.db";
    if (sqlite3_open_v2(path.c_str(), &database, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
      Fail("open " + path);
    }
    sqlite3_stmt* query = nullptr;
    sqlite3_prepare_v2(database, "SELECT coalesce(max(id), 0) FROM message", -1, &query, nullptr);
    const auto deadline = Clock::now() + std::chrono::seconds(60);
    for (;;) {
      const bool there =
          sqlite3_step(query) == SQLITE_ROW && sqlite3_column_int64(query, 0) >= rows;
      sqlite3_reset(query);
      if (there) break;
      if (Clock::now() > deadline) Fail("rows missing");
      std::this_thread::sleep_for(std::chrono::microseconds(500));
    }
    sqlite3_finalize(query);
    sqlite3_close(database);
  }
  [[nodiscard]] double cpuSeconds() const {
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
  [[nodiscard]] double residentMegabytes() const {
    std::ifstream file(fmt::format("/proc/{}/status", process_));
    for (std::string line; std::getline(file, line);) {
      if (line.starts_with("VmRSS:")) return std::stod(line.substr(6)) / 1024;
    }
    return 0;
  }

 private:
  std::filesystem::path directory_;
  pid_t process_ = -1;
};

double Median(std::vector<double> values) {
  std::ranges::sort(values);
  return values[values.size() / 2];
}

/// What is measured: the service with one row a message, with two (the analytics event too), and
/// the floor.
enum class Subject { service, serviceWithAnalytics, floor };
constexpr std::array kSubjects = {Subject::service, Subject::serviceWithAnalytics, Subject::floor};

std::string JsonOfTypicalPayload() {
  return JsonText(Payload(TypicalPayload()));
}

std::unique_ptr<Server> Start(Subject subject, const std::string& quarveld) {
  auto server = std::make_unique<Server>([&](const std::filesystem::path& directory) {
    if (subject == Subject::floor) RunFloor(directory, JsonOfTypicalPayload());
    const std::string path = directory;
    std::ofstream(directory / "quarvel.toml")
        << "[log]\nlevel = \"error\"\n[analytics]\nwanted = ["
        << (subject == Subject::service ? "" : "\"*\"") << "]\n";
    for (const char* name : {"RUNTIME_DIRECTORY", "STATE_DIRECTORY", "CONFIGURATION_DIRECTORY"}) {
      setenv(name, path.c_str(), 1);
    }
    unsetenv("QUARVEL_SOCKET");
    execl(quarveld.c_str(), quarveld.c_str(), nullptr);
    Fail("exec " + quarveld);
  });
  Client(server->socket());  // returns once it is served
  return server;
}

/// A client with a started session, as far as the subject knows of sessions.
std::unique_ptr<Client> Connect(Server& server, Subject subject, std::int64_t reporterID) {
  auto client = std::make_unique<Client>(server.socket());
  if (subject != Subject::floor) {
    client->call("createReportingSession:reply:", reporterID);
    client->call("startReportingSessionForID:reply:", reporterID, false);
  }
  return client;
}

struct Throughput {
  double messagesPerSecond;
  double cpuSecondsPerMillion;
};

/// From the first message sent until all are in the store.
Throughput MeasureThroughput(Subject subject, const std::string& quarveld, std::size_t clients,
                             std::size_t messages) {
  const auto server = Start(subject, quarveld);
  std::vector<std::unique_ptr<Client>> connections;
  for (std::size_t i = 0; i < clients; ++i) {
    connections.push_back(Connect(*server, subject, static_cast<std::int64_t>(i + 1)));
  }
  const double cpuBefore = server->cpuSeconds();
  const auto begin = Clock::now();
  std::vector<std::thread> threads;
  for (std::size_t i = 0; i < clients; ++i) {
    threads.emplace_back([&, i] {
      connections[i]->pipeline(static_cast<std::int64_t>(i + 1), messages / clients, 64);
    });
  }
  for (std::thread& thread : threads) thread.join();
  server->waitForRows(static_cast<std::int64_t>(messages / clients * clients));
  const double seconds = std::chrono::duration<double>(Clock::now() - begin).count();
  const auto count = static_cast<double>(messages);
  return {count / seconds, (server->cpuSeconds() - cpuBefore) * 1e6 / count};
}

struct RoundTrip {
  double p50;
  double p99;
};

/// Microseconds, one call in flight.
RoundTrip MeasureRoundTrip(Subject subject, const std::string& quarveld) {
  constexpr std::size_t kTrips = 20'000;
  const auto server = Start(subject, quarveld);
  const auto client = Connect(*server, subject, 1);
  const std::string frame = SendMessageFrame(7, 1);
  std::vector<double> trips;
  for (std::size_t i = 0; i < kTrips; ++i) {
    const auto begin = Clock::now();
    client->write(frame);
    client->readReplies();
    trips.push_back(std::chrono::duration<double, std::micro>(Clock::now() - begin).count());
  }
  std::ranges::sort(trips);
  return {trips[kTrips / 2], trips[kTrips * 99 / 100]};
}

struct Memory {
  double idle;
  double afterMessages;
};

/// Resident megabytes.
Memory MeasureMemory(const std::string& quarveld) {
  constexpr std::size_t kMessages = 100'000;
  const auto server = Start(Subject::service, quarveld);
  const auto client = Connect(*server, Subject::service, 1);
  client->call("reporterID:valid:", 1);
  const double idle = server->residentMegabytes();
  client->pipeline(1, kMessages, 64);
  server->waitForRows(kMessages);
  return {idle, server->residentMegabytes()};
}

std::string_view NameOf(Subject subject) {
  switch (subject) {
    case Subject::service:
      return "service, one row";
    case Subject::serviceWithAnalytics:
      return "service, two rows";
    case Subject::floor:
      return "floor";
  }
  return "";
}

int Main(const std::string& quarveld, std::size_t messages, std::size_t rounds) {
  std::map<Subject, std::vector<double>> one, eight, cpu, p50, p99;
  std::vector<double> idle, full;
  for (std::size_t round = 0; round < rounds; ++round) {
    fmt::print(stderr, "round {} of {}\n", round + 1, rounds);
    for (const Subject subject : kSubjects) {
      one[subject].push_back(MeasureThroughput(subject, quarveld, 1, messages).messagesPerSecond);
      const Throughput many = MeasureThroughput(subject, quarveld, 8, messages);
      eight[subject].push_back(many.messagesPerSecond);
      cpu[subject].push_back(many.cpuSecondsPerMillion);
      const RoundTrip trip = MeasureRoundTrip(subject, quarveld);
      p50[subject].push_back(trip.p50);
      p99[subject].push_back(trip.p99);
    }
    const Memory memory = MeasureMemory(quarveld);
    idle.push_back(memory.idle);
    full.push_back(memory.afterMessages);
  }
  fmt::print("{:<20}{:>14}{:>14}{:>12}{:>11}{:>11}\n", "medians", "msg/s, 1", "msg/s, 8", "CPU s/M",
             "p50 us", "p99 us");
  for (const Subject subject : kSubjects) {
    fmt::print("{:<20}{:>14.0f}{:>14.0f}{:>12.2f}{:>11.1f}{:>11.1f}\n", NameOf(subject),
               Median(one[subject]), Median(eight[subject]), Median(cpu[subject]),
               Median(p50[subject]), Median(p99[subject]));
  }
  for (const Subject subject : {Subject::service, Subject::serviceWithAnalytics}) {
    const auto ratio = [&](std::map<Subject, std::vector<double>>& figures) {
      return Median(figures[subject]) / Median(figures[Subject::floor]);
    };
    fmt::print("{:<20}{:>14.2f}{:>14.2f}{:>12.2f}{:>11.2f}{:>11.2f}\n", "  / floor", ratio(one),
               ratio(eight), ratio(cpu), ratio(p50), ratio(p99));
  }
  fmt::print(
      "resident: {:.1f} MB idle with one client, {:.1f} MB after 100,000 messages in one "
      "session\n",
      Median(idle), Median(full));
  return 0;
}

}  // namespace
}  // namespace quarvel

int main(int argc, char** argv) {
  if (argc < 2) {
    fmt::print(stderr, "usage: service-bench QUARVELD [MESSAGES] [ROUNDS]\n");
    return 2;
  }
  std::signal(SIGPIPE, SIG_IGN);
  return quarvel::Main(argv[1], argc > 2 ? std::stoul(argv[2]) : 200'000,
                       argc > 3 ? std::stoul(argv[3]) : 5);
}
