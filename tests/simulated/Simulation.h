#pragma once

#include <gtest/gtest.h>

#include <initializer_list>
#include <ostream>

#include "base/Json.h"
#include "platform/WorkQueue.h"
#include "tests/simulated/Recorders.h"
#include "tests/simulated/Scheduler.h"

namespace quarvel {

using namespace std::chrono_literals;  // NOLINT(google-build-using-namespace): durations in tests

// Texts of the project's values in GoogleTest's failures.
template <class T>
requires requires(const T& value) {
  JsonText(value);
}
void PrintTo(const T& value, std::ostream* out) {
  *out << JsonText(value);
}
inline void PrintTo(const Error& error, std::ostream* out) {
  *out << error.description();
}

/// The seeds for which a test repeats its body, for a range-for. Ends once the test has failed: the
/// first failing seed is enough.
class Seeds {
 public:
  /// `QUARVEL_SEED` alone when it is set, to replay a failure; else `QUARVEL_SEEDS` seeds (25 times
  /// as many when `QUARVEL_NIGHTLY` is set), 20 by default.
  Seeds();
  [[nodiscard]] Seeds begin() const { return *this; }
  [[nodiscard]] std::default_sentinel_t end() const { return {}; }
  std::uint64_t operator*() const { return first_; }
  void operator++() { ++first_; }
  bool operator!=(std::default_sentinel_t) const {
    return first_ <= last_ && !testing::Test::HasFailure();
  }
  [[nodiscard]] std::uint64_t size() const { return last_ - first_ + 1; }

 private:
  std::uint64_t first_ = 1;
  std::uint64_t last_ = 20;
};

/// Every event that reached the platform, a line each in order of arrival, for asserting an order
/// across kinds. The recorder of each kind has the details.
struct Journal : std::vector<std::string> {
  /// The lines that begin with one of `prefixes`.
  [[nodiscard]] std::vector<std::string> lines(std::initializer_list<std::string_view>) const;
};

/// The simulated platform: implements every header of `platform/` from its construction to its
/// destruction. A test owns one. Objects that the test declares after it are destroyed before it,
/// so a thread that may still wait at the end must share its objects: it unwinds at destruction.
///
/// The test arranges (switches, connections, threads), runs, and asserts on the recorders; nothing
/// happens between two runs. Every failure names the seed.
class Simulation {
 public:
  explicit Simulation(std::uint64_t seed);
  ~Simulation();
  Simulation(const Simulation&) = delete;
  Simulation& operator=(const Simulation&) = delete;

  [[nodiscard]] static Simulation& current();
  void run() { scheduler.run(); }
  void runFor(Scheduler::Duration duration) { scheduler.runFor(duration); }
  void spawn(std::string name, Block body) { scheduler.spawn(std::move(name), std::move(body)); }
  [[nodiscard]] Scheduler::Duration elapsed() const { return scheduler.elapsed(); }
  /// For recorders: notes a line unless the process is over.
  void note(std::string line) {
    if (!scheduler.stopped()) journal.push_back(std::move(line));
  }

  /// Switch: waits in a `Condition` may end without a signal, at a moment chosen by the seed.
  bool spuriousWakeUps = false;
  std::vector<std::pair<std::string, std::size_t>> queues;  // label and number of each serial one
  std::size_t briefBlocks = 0;                              // on all queues
  bool internalBuild = false;                               // device property, as the next
  std::optional<std::int64_t> deviceClass;
  Journal journal;
  SimulatedCounters counters;
  std::vector<Arrival> arrivals;
  SimulatedLog log;
  SimulatedRandom random;
  std::map<std::int32_t, std::string> processes;  // the process table: command names
  std::vector<std::pair<std::string, Payload>> analyticsEvents;
  std::vector<Payload> powerRecords;
  SimulatedAgent agent;
  std::map<std::string, Dictionary, std::less<>> preferences;  // domain to entries
  SimulatedNotifications notifications;
  SimulatedTallix tallix;
  SimulatedOrientation orientation;
  SimulatedFiles files;
  SimulatedListener listener;
  Scheduler scheduler;
  std::unique_ptr<WorkQueue> serverQueue;  // behind `ProcessServerQueue`

 private:
  const testing::ScopedTrace seedTrace_;
};

[[nodiscard]] inline Scheduler& TheScheduler() {
  return Simulation::current().scheduler;
}

}  // namespace quarvel

/// A test whose body is a member function of a simulation, made anew for each seed.
#define SEEDED_TEST(suite, name, Simulated)                      \
  struct suite##_##name final : Simulated {                      \
    using Simulated::Simulated;                                  \
    void body();                                                 \
  };                                                             \
  TEST(suite, name) {                                            \
    for (const auto seed : Seeds()) suite##_##name(seed).body(); \
  }                                                              \
  void suite##_##name::body()
