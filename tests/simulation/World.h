#pragma once

#include <cstdint>
#include <random>
#include <string>
#include <vector>

#include "tests/Statistics/Service/RunningService.h"
#include "tests/simulation/Model.h"

namespace quarvel {

/// The whole service among clients, an agent, files and clocks that do as they please: everything
/// comes from the seed, and the same seed does the same again.
class World {
 public:
  struct Counts {
    std::size_t calls = 0;
    std::size_t accepted = 0;    // messages: those below together
    std::size_t handedOver = 0;  // messages and single messages that reached the agent
    std::size_t refused = 0;     // by the agent
    std::size_t dropped = 0;     // of a test session, or for want of an agent session
  };

  explicit World(std::uint64_t seed, Lie lie = Lie::none);
  /// Of this process: yes, unless QUARVEL_CUSTOMER_BUILD is set.
  [[nodiscard]] static bool isInternalBuild();

  /// Lives through it, to the end of every client, and compares.
  void run();
  /// What was not as it should have been, a sentence each.
  [[nodiscard]] const std::vector<std::string>& findings() const { return findings_; }
  [[nodiscard]] const Counts& counts() const { return counts_; }
  /// Of everything that happened.
  [[nodiscard]] std::size_t traceHash() const;

 private:
  [[nodiscard]] std::uint64_t draw(std::uint64_t bound) { return random_() % bound; }
  [[nodiscard]] bool oneIn(std::uint64_t chances) { return draw(chances) == 0; }
  [[nodiscard]] std::int64_t drawReporterID();
  [[nodiscard]] Dictionary drawPayload();
  void step();
  void act(Client& client);
  void sendSomething(Client& client);
  void disturb();
  void changePreferences();

  void compare();
  void compareReplies();
  void compareAgentSessions();
  void compareRuns(const Model::Session& session,
                   const std::vector<const SimulatedAgent::Session*>& made);
  void compareUnsettled(const Model::Session& session,
                        const std::vector<const SimulatedAgent::Session*>& made);
  void compareSingleMessages();
  void compareSinks();
  void compareHistories();
  void compareLifetimes();
  void compareCounters();
  void expect(bool holds, const std::string& otherwise) {
    if (!holds) findings_.push_back(otherwise);
  }

  std::mt19937_64 random_;
  RunningService service_;
  Simulation& simulation_;
  std::vector<Client> clients_;
  std::vector<Client> gone_;
  Model model_;
  std::size_t notifications_ = 0;
  std::int64_t messages_ = 0;
  bool clockSteps_ = false;
  Counts counts_;
  std::vector<std::string> findings_;
};

}  // namespace quarvel
