#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/WorkQueue.h"
#include "tests/simulated/Printers.h"
#include "tests/simulated/Scheduler.h"
#include "tests/simulated/Seeds.h"
#include "tests/simulated/SimulatedAgent.h"
#include "tests/simulated/SimulatedListener.h"
#include "tests/simulated/SimulatedLog.h"
#include "tests/simulated/SimulatedSettings.h"
#include "tests/simulated/SimulatedSinks.h"
#include "tests/simulated/SimulatedSystem.h"
#include "tests/simulated/SimulatedTallix.h"

namespace quarvel {

using namespace std::chrono_literals;  // NOLINT(google-build-using-namespace): durations in tests

/// Everything that reached the platform, of whatever kind, a line each in the order it came. For
/// asserting an order across kinds; each kind's own recorder has the details.
class Journal {
 public:
  /// The lines that begin with one of `prefixes`.
  [[nodiscard]] std::vector<std::string> lines(std::initializer_list<std::string_view> prefixes = {
                                                   ""}) const;
  void clear() { lines_.clear(); }
  void note(std::string line) { lines_.push_back(std::move(line)); }

 private:
  std::vector<std::string> lines_;
};

/// What the simulated platform can be told to get wrong, once, so that a test can show that its
/// checks would notice.
enum class Lie : std::uint8_t {
  none,
  messageLost,
  messageTwice,
  messagesSwapped,
  singleMessageLost,
  flushLost,
  replyLost,
  replyTwice,
  historyCut,
  eventLost,
  connectionKept,
};

/// The simulated platform, one a test: stands behind every header of `platform/` from its
/// construction to its destruction. What is declared after it in a test is destroyed before it, so
/// a thread that may still wait at the end must share what it uses: it unwinds at the destruction.
///
/// The test arranges (switches, connections, threads), runs, and asserts on what was recorded;
/// nothing happens between two runs. Every failure names the seed.
class Simulation {
 public:
  struct CreatedQueue {
    std::string label;
    std::size_t number = 0;
  };

  explicit Simulation(std::uint64_t seed);
  ~Simulation();
  Simulation(const Simulation&) = delete;
  Simulation& operator=(const Simulation&) = delete;

  [[nodiscard]] static Simulation& current();

  void run() { scheduler.run(); }
  void runFor(Scheduler::Duration duration) { scheduler.runFor(duration); }
  void spawn(std::string name, Block body) { scheduler.spawn(std::move(name), std::move(body)); }
  [[nodiscard]] Scheduler::Duration elapsed() const { return scheduler.elapsed(); }

  /// For recorders: whether to tell `what`, which is told once.
  [[nodiscard]] bool tells(Lie what) {
    if (lie != what) return false;
    lie = Lie::none;
    return true;
  }
  /// For recorders: notes a line unless the process is over.
  void note(std::string line) {
    if (!scheduler.stopped()) journal.note(std::move(line));
  }

  /// Switch: waits in a `Condition` may end without a signal, at a moment chosen by the seed.
  bool spuriousWakeUps = false;
  /// Switch: what the platform gets wrong.
  Lie lie = Lie::none;
  std::vector<CreatedQueue> queues;
  // Device properties.
  bool internalBuild = false;
  std::optional<std::int64_t> deviceClass;

  Journal journal;
  SimulatedCounters counters;
  std::vector<Arrival> arrivals;
  SimulatedLog log;
  SimulatedRandom random;
  /// The kernel's process table: command names.
  std::map<std::int32_t, std::string> processes;
  SimulatedVistrel vistrel;
  SimulatedOhmrik ohmrik;
  SimulatedAgent agent;
  SimulatedPreferences preferences;
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

}  // namespace quarvel
