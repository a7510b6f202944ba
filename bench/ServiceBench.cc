// Measures the service, its floor and its peers in turn, round by round, in one run, since only
// figures of the same run are comparable. Prints medians with their spread, and the targets.
//
// Usage: service-bench QUARVELD [--messages N] [--rounds N] [--peers DIRECTORY]

#include <fmt/format.h>

#include <algorithm>
#include <chrono>
#include <csignal>
#include <map>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "base/Payload.h"
#include "bench/Subject.h"

#include <quarvel/client.hpp>

namespace quarvel {
namespace {

using Clock = std::chrono::steady_clock;

double SecondsSince(Clock::time_point begin) {
  return std::chrono::duration<double>(Clock::now() - begin).count();
}

/// The figures of one measure, one per round.
class Samples {
 public:
  void add(double value) { values_.push_back(value); }
  [[nodiscard]] bool empty() const { return values_.empty(); }
  [[nodiscard]] double median() const {
    std::vector<double> sorted = values_;
    std::ranges::sort(sorted);
    return sorted[sorted.size() / 2];
  }
  /// The distance between the extremes, as a share of the median.
  [[nodiscard]] double spread() const {
    const auto [low, high] = std::ranges::minmax(values_);
    return median() == 0 ? 0 : (high - low) / median();
  }

 private:
  std::vector<double> values_;
};

/// The figures of all measures (rows) and subjects (columns), each in the order of its first use.
class Table {
 public:
  void add(const std::string& measure, const Subject& subject, double value) {
    if (std::ranges::find(measures_, measure) == measures_.end()) measures_.push_back(measure);
    if (std::ranges::find(subjects_, subject.name()) == subjects_.end()) {
      subjects_.push_back(subject.name());
    }
    cells_[{measure, subject.name()}].add(value);
  }
  [[nodiscard]] double median(const std::string& measure, const std::string& subject) const {
    const auto cell = cells_.find({measure, subject});
    return cell == cells_.end() ? 0 : cell->second.median();
  }
  /// Prints a Markdown table, which is readable as plain text too.
  void print() const {
    fmt::print("| {:<34} |", "medians (spread)");
    for (const std::string& subject : subjects_) fmt::print(" {:>18} |", subject);
    fmt::print("\n|{:-<36}|", "");
    for (std::size_t i = 0; i < subjects_.size(); ++i) fmt::print("{:->19}:|", "");
    fmt::print("\n");
    for (const std::string& measure : measures_) {
      fmt::print("| {:<34} |", measure);
      for (const std::string& subject : subjects_) {
        const auto cell = cells_.find({measure, subject});
        fmt::print(" {:>18} |", cell == cells_.end() ? "" : text(cell->second));
      }
      fmt::print("\n");
    }
  }

 private:
  static std::string text(const Samples& samples) {
    const double value = samples.median();
    const int decimals = value >= 1000 ? 0 : value >= 10 ? 1 : 2;
    return fmt::format("{:.{}f} ({:.0f} %)", value, decimals, samples.spread() * 100);
  }

  std::vector<std::string> measures_;
  std::vector<std::string> subjects_;
  std::map<std::pair<std::string, std::string>, Samples> cells_;
};

constexpr const char* kOneClient = "messages/s stored, 1 client";
constexpr const char* kEightClients = "messages/s stored, 8 clients";
constexpr const char* kProcessor = "CPU seconds per million messages";
constexpr const char* kPeak = "peak resident MB, 8 clients";
constexpr const char* kWritten = "bytes written / bytes stored";
constexpr const char* kTripHalf = "round trip us, p50";
constexpr const char* kTripMost = "round trip us, p99";
constexpr const char* kTripTail = "round trip us, p99.9";
constexpr const char* kStart = "start to first answer ms";
constexpr const char* kIdleResident = "idle resident MB";
constexpr const char* kIdleProportional = "idle proportional MB";
constexpr const char* kHistory = "history, bytes beside a payload";
constexpr const char* kBroadcast = "broadcast to 1,000 sessions us";
constexpr const char* kClientCost = "client: one sendMessage us";

std::string WakeUpsOf(std::size_t clients) {
  return fmt::format("wake-ups a minute, {} clients", clients);
}

/// Measures from the first message sent until all messages are stored.
void MeasureThroughput(Table& table, const Subject& subject, std::size_t clients,
                       std::size_t messages) {
  const auto server = subject.start();
  std::vector<std::unique_ptr<WireClient>> connections;
  for (std::size_t i = 1; i <= clients; ++i) {
    connections.push_back(subject.connect(*server, static_cast<std::int64_t>(i)));
  }
  const double processorBefore = server->cpuSeconds();
  const std::uint64_t writtenBefore = server->bytesWritten();
  const auto begin = Clock::now();
  std::vector<std::thread> threads;
  for (std::size_t i = 0; i < clients; ++i) {
    threads.emplace_back([&, i] {
      subject.send(*connections[i], static_cast<std::int64_t>(i + 1), messages / clients);
    });
  }
  for (std::thread& thread : threads) thread.join();
  subject.awaitStored(*server, messages / clients * clients);
  const auto count = static_cast<double>(messages);
  table.add(clients == 1 ? kOneClient : kEightClients, subject, count / SecondsSince(begin));
  if (clients == 1) return;
  table.add(kProcessor, subject, (server->cpuSeconds() - processorBefore) * 1e6 / count);
  table.add(kPeak, subject, server->peakMegabytes());
  table.add(kWritten, subject,
            static_cast<double>(server->bytesWritten() - writtenBefore) /
                static_cast<double>(subject.fileBytes(*server)));
}

/// Measures the latency of calls with one call in flight.
void MeasureRoundTrip(Table& table, const Subject& subject) {
  constexpr std::size_t kTrips = 20'000;
  const auto server = subject.start();
  const auto client = subject.connect(*server, 1);
  const std::string frame = subject.frame(1);
  std::vector<double> trips;
  for (std::size_t i = 0; i < kTrips; ++i) {
    const auto begin = Clock::now();
    client->write(frame);
    client->readReplies();
    trips.push_back(SecondsSince(begin) * 1e6);
  }
  std::ranges::sort(trips);
  table.add(kTripHalf, subject, trips[kTrips / 2]);
  table.add(kTripMost, subject, trips[kTrips * 99 / 100]);
  table.add(kTripTail, subject, trips[kTrips * 999 / 1000]);
}

void MeasureIdle(Table& table, const Subject& service) {
  constexpr std::chrono::seconds kWatched(6);
  const auto server = service.start();
  // With an existing store, the case of every start except the first.
  service.restart(*server);
  const auto begin = Clock::now();
  std::vector<std::unique_ptr<WireClient>> clients;
  clients.push_back(service.connect(*server, 0));
  clients.front()->call("reporterID:valid:", 0);
  table.add(kStart, service, SecondsSince(begin) * 1e3);
  for (const std::size_t connected : {std::size_t{1}, std::size_t{100}, std::size_t{0}}) {
    while (clients.size() < connected) {
      clients.push_back(service.connect(*server, static_cast<std::int64_t>(clients.size() + 1)));
    }
    clients.resize(connected);
    std::this_thread::sleep_for(std::chrono::seconds(2));
    if (connected == 1) {
      table.add(kIdleResident, service, server->residentMegabytes());
      table.add(kIdleProportional, service, server->proportionalMegabytes());
    }
    const std::uint64_t before = server->wakeUps();
    std::this_thread::sleep_for(kWatched);
    table.add(WakeUpsOf(connected), service,
              static_cast<double>((server->wakeUps() - before) * 60) /
                  static_cast<double>(kWatched.count()));
  }
}

void MeasureHistory(Table& table, const Subject& service) {
  constexpr std::size_t kMessages = 100'000;
  const auto server = service.start();
  const auto client = service.connect(*server, 1);
  // Measures the second hundred thousand messages: the first have grown the buffers already.
  client->pipeline(service.frame(1), kMessages, 64);
  service.awaitStored(*server, kMessages);
  const double before = server->residentMegabytes();
  client->pipeline(service.frame(1), kMessages, 64);
  service.awaitStored(*server, 2 * kMessages);
  const double grown = (server->residentMegabytes() - before) * 1024 * 1024;
  const auto payload = static_cast<double>(Payload(TypicalPayload()).encoded().size());
  table.add(kHistory, service, grown / kMessages - payload);
}

/// Measures from the call to its reply, which comes after the server queue has served all sessions.
void MeasureBroadcast(Table& table, const Subject& service) {
  constexpr std::int64_t kSessions = 1000;
  constexpr std::size_t kBroadcasts = 50;
  const auto server = service.start();
  const auto client = service.connect(*server, 1);
  for (std::int64_t id = 2; id <= kSessions; ++id) client->startSession(id);
  std::vector<double> taken;
  for (std::size_t i = 1; i <= kBroadcasts; ++i) {
    const auto begin = Clock::now();
    client->write(SendMessageFrame(1, 0));
    client->readReplies();
    taken.push_back(SecondsSince(begin) * 1e6);
    service.awaitStored(*server, i * kSessions);
  }
  std::ranges::sort(taken);
  table.add(kBroadcast, service, taken[kBroadcasts / 2]);
}

/// Measures a call of the client library that does not wait for its reply.
void MeasureClient(Table& table, const Subject& service) {
  constexpr std::size_t kBursts = 100;
  constexpr std::size_t kBurst = 100;
  const auto server = service.start();
  auto client = Client::connect((server->directory() / "reporting.sock").native());
  if (!client) throw std::runtime_error(client.error().description());
  client.value().createReportingSession(1);
  client.value().startReportingSessionForID(1);
  const Payload payload(TypicalPayload());
  double spent = 0;
  for (std::size_t i = 1; i <= kBursts; ++i) {
    const auto begin = Clock::now();
    for (std::size_t sent = 0; sent < kBurst; ++sent) {
      client.value().sendMessage(payload, {vocabulary::Component::hal, vocabulary::Kind::playback},
                                 vocabulary::MessageType::generic, 1);
    }
    spent += SecondsSince(begin);
    service.awaitStored(*server, i * kBurst);
  }
  table.add(kClientCost, service, spent * 1e6 / (kBursts * kBurst));
}

void PrintTargets(const Table& table) {
  const std::string one = "service, one row";
  const std::string two = "service, two rows";
  const auto ratio = [&table](const char* measure, const std::string& subject,
                              const std::string& other) {
    const double base = table.median(measure, other);
    return base == 0 ? 0 : table.median(measure, subject) / base;
  };
  const double ratePerClient =
      table.median(kOneClient, one) / std::max(table.median(kEightClients, one), 1.0);
  struct Target {
    const char* what;
    double value;
    double bound;
    bool atLeast;
  };
  for (const Target& target : {
           Target{"8 clients, one row / floor", ratio(kEightClients, one, "floor, one row"), 0.75,
                  true},
           Target{"8 clients, one row / redis-server", ratio(kEightClients, one, "redis-server"), 1,
                  true},
           Target{"8 clients, two rows / floor", ratio(kEightClients, two, "floor, two rows"), 0.75,
                  true},
           Target{"one client / eight", ratePerClient, 0.6, true},
           Target{"CPU seconds per million", table.median(kProcessor, one), 3.0, false},
           Target{"round trip p50 / echo", ratio(kTripHalf, one, "echo"), 1.2, false},
           Target{"round trip p99 / echo", ratio(kTripMost, one, "echo"), 2, false},
           Target{"wake-ups a minute, 100 clients", table.median(WakeUpsOf(100), one), 0, false},
           Target{"idle resident MB", table.median(kIdleResident, one), 8, false},
           Target{"idle proportional MB", table.median(kIdleProportional, one), 4, false},
           Target{"start to first answer ms", table.median(kStart, one), 8, false},
           Target{"bytes written / stored", table.median(kWritten, one), 1.5, false},
           Target{"history, bytes beside a payload", table.median(kHistory, one), 96, false},
           Target{"broadcast to 1,000 sessions us", table.median(kBroadcast, one), 1000, false},
       }) {
    const bool reached =
        target.atLeast ? target.value >= target.bound : target.value <= target.bound;
    fmt::print("{:<36}{:>8.2f}  {} {:g}  {}\n", target.what, target.value,
               target.atLeast ? ">=" : "<=", target.bound, reached ? "reached" : "NOT REACHED");
  }
}

int Main(const std::string& quarveld, const std::string& peers, std::size_t messages,
         std::size_t rounds) {
  std::vector<std::unique_ptr<Subject>> subjects;
  subjects.push_back(ServiceSubject(quarveld, 1));
  subjects.push_back(ServiceSubject(quarveld, 2));
  subjects.push_back(FloorSubject(1));
  subjects.push_back(FloorSubject(2));
  subjects.push_back(FloorSubject(0));
  for (auto& peer : PeerSubjects(peers)) subjects.push_back(std::move(peer));

  Table table;
  for (std::size_t round = 1; round <= rounds; ++round) {
    for (const auto& subject : subjects) {
      fmt::print(stderr, "\rround {} of {}: {:<20}", round, rounds, subject->name());
      if (subject->stores()) {
        MeasureThroughput(table, *subject, 1, messages);
        MeasureThroughput(table, *subject, 8, messages);
      }
      if (subject->acknowledges()) MeasureRoundTrip(table, *subject);
    }
    MeasureIdle(table, *subjects.front());
    MeasureHistory(table, *subjects.front());
    MeasureBroadcast(table, *subjects.front());
    MeasureClient(table, *subjects.front());
  }
  fmt::print(stderr, "\r{:<40}\r", "");
  table.print();
  fmt::print("\n");
  PrintTargets(table);
  return 0;
}

}  // namespace
}  // namespace quarvel

int main(int argc, char** argv) {
  std::signal(SIGPIPE, SIG_IGN);
  std::map<std::string, std::string> options{
      {"--messages", "200000"}, {"--rounds", "5"}, {"--peers", "/"}};
  bool usable = argc >= 2 && argc % 2 == 0;
  for (int i = 2; usable && i < argc; i += 2) {
    usable = options.contains(argv[i]);
    options[argv[i]] = argv[i + 1];
  }
  if (!usable) {
    fmt::print(stderr,
               "usage: service-bench QUARVELD [--messages N] [--rounds N] [--peers DIRECTORY]\n");
    return 2;
  }
  return quarvel::Main(argv[1], options["--peers"], std::stoul(options["--messages"]),
                       std::stoul(options["--rounds"]));
}
